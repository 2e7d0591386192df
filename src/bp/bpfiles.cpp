// bpfiles.cpp: which loaded module file a breakpoint's file name stands for (see bpops.h).
//
// The loaded-module table maps every name under which a module's file has been seen (the
// name it was registered with, and every other spelling found to be the same file) to the
// canonical name: the one the file was first registered under. Names are compared by file
// identity (samefile); once a spelling is known, later questions about it are one lookup.
#include <cstdlib>
#include <cstring>

#include "bp/bpops.h"
#include "names/conames.h"
#include "support/dbgcommon.h"
#include "support/dprintf.h"

namespace {

const char* canonical_of(CU_HashEntry* entry) {
  return static_cast<const char*>(CU_GetHashValue(entry));
}

// Stores a copy of `canonical` as the value of `entry`, freeing a value it had; the stored
// copy, or null (entry deleted) when memory runs out.
const char* store_canonical(BpOpsData* data, CU_HashEntry* entry, const char* canonical) {
  ++data->modules_generation;
  char* copy = strdup(canonical);
  if (copy == nullptr) {
    std::free(CU_GetHashValue(entry));
    CU_DeleteHashEntry(entry);
    return nullptr;
  }
  std::free(CU_GetHashValue(entry));
  CU_SetHashValue(entry, copy);
  return copy;
}

// Copies a module's file name into the scratch buffer, reduced to its source file. A name
// that does not fit is refused: no module file of ours is that long.
bool copy_module_name(BpOpsData* data, const char* module_file) {
  size_t length = std::strlen(module_file);
  if (length > kMaxPathLen) {
    do_dprintf(kDbgBpFiles, "Module file name too long: not registered\n");
    return false;
  }
  std::memcpy(data->module_name_buffer, module_file, length + 1);
  prune_py_c_or_o(data->module_name_buffer);
  return true;
}

// Gives every breakpoint that still waits for its module the newly registered `module_file`
// when the breakpoint's name is the same file.
void resolve_waiting_breakpoints(BpOpsData* data, const char* module_file) {
  CU_HashSearch search;
  for (CU_HashEntry* e = CU_FirstHashEntry(&data->bp_table, &search); e != nullptr;
       e = CU_NextHashEntry(&search)) {
    for (auto* bp = static_cast<Breakpoint*>(CU_GetHashValue(e)); bp != nullptr;
         bp = bp->next_at_line) {
      do_dprintf(kDbgBpFiles, "lineno = %d, user_filename = %s, module_filename = %s\n", bp->lineno,
                 dprint_check_str(bp->user_filename), dprint_check_str(bp->module_filename));
      if (bp->module_filename != nullptr) continue;
      const char* found = add_to_loaded_modules_if_samefile(data, bp->user_filename, module_file);
      // Without memory for the copy the breakpoint simply goes on waiting.
      if (found != nullptr) bp->module_filename = strdup(found);
    }
  }
}

}  // namespace

const char* add_to_loaded_modules_if_samefile(BpOpsData* data, const char* name,
                                              const char* module_file) {
  if (!samefile(data->file_ops, name, module_file)) return nullptr;
  int is_new = 0;
  CU_HashEntry* entry = CU_CreateHashEntry(&data->loaded_modules, name, &is_new);
  if (entry == nullptr) return nullptr;
  if (is_new) CU_SetHashValue(entry, nullptr);
  const char* stored = store_canonical(data, entry, module_file);
  if (stored != nullptr) do_dprintf(kDbgBpFiles, "Found synonym %s\n", dprint_check_str(name));
  return stored;
}

const char* __tracer_find_module(BpOpsData* data, const char* name) {
  do_dprintf(kDbgBpFiles, "Finding module for %s\n", dprint_check_str(name));
  if (name == nullptr) return nullptr;
  CU_HashEntry* exact = CU_FindHashEntry(&data->loaded_modules, name);
  if (exact != nullptr) return canonical_of(exact);
  do_dprintf(kDbgBpFiles, "Nothing found... searching for synonyms\n");
  CU_HashSearch search;
  for (CU_HashEntry* e = CU_FirstHashEntry(&data->loaded_modules, &search); e != nullptr;
       e = CU_NextHashEntry(&search)) {
    // Adding `name` may grow the table under the walk: take the canonical name out first and
    // stop at the first find.
    const char* found = add_to_loaded_modules_if_samefile(data, name, canonical_of(e));
    if (found != nullptr) return found;
  }
  do_dprintf(kDbgBpFiles, "No synonyms found\n");
  return nullptr;
}

void __tracer_clear_loaded_modules(BpOpsData* data) {
  ++data->modules_generation;
  CU_DeallocHashTable(&data->loaded_modules);
  CU_InitHashTable(&data->loaded_modules, 0);
}

int __tracer_find_bp_filename_synonyms(BpOpsData* data, Breakpoint* bp) {
  do_dprintf(kDbgBpFiles, "FINDING BP FILENAME SYNONYMS\n");
  if (bp->module_filename != nullptr) {
    do_dprintf(kDbgBpFiles, "Not adding:  Already added before\n");
    return 1;
  }
  const char* modfile = __tracer_find_module(data, bp->user_filename);
  do_dprintf(kDbgBpFiles, "  modfile = %s\n", dprint_check_str(modfile));
  if (modfile == nullptr) {
    do_dprintf(kDbgBpFiles, "No loaded module for the bp... exiting find_bp_filename_synonyms\n");
    return 1;
  }
  bp->module_filename = strdup(modfile);
  do_dprintf(kDbgBpFiles, "bp->module_filename = %s\n", dprint_check_str(bp->module_filename));
  if (bp->module_filename == nullptr) {
    PyErr_SetString(PyExc_MemoryError, "Out of memory");
    return 0;
  }
  do_dprintf(kDbgBpFiles, "^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^^\n");
  do_dprintf(kDbgBpFiles, "Added bp %s, %i\n", dprint_check_str(bp->module_filename), bp->lineno);
  return 1;
}

void __tracer_resolve_bp_filenames(BpOpsData* data, const char* module_file) {
  do_dprintf(kDbgBpFiles, "__tracer_resolve_bp_filenames(module_filename = %s)\n",
             dprint_check_str(module_file));
  if (module_file == nullptr || !copy_module_name(data, module_file)) return;
  const char* name = data->module_name_buffer;
  if (__tracer_find_module(data, name) != nullptr) return;  // a module file already known
  int is_new = 0;
  CU_HashEntry* entry = CU_CreateHashEntry(&data->loaded_modules, name, &is_new);
  if (entry == nullptr || !is_new) return;
  CU_SetHashValue(entry, nullptr);
  if (store_canonical(data, entry, name) == nullptr) return;
  ++data->unique_import_count;
  resolve_waiting_breakpoints(data, name);
  do_dprintf(kDbgBpFiles, "Done resolving\n");
}

void __tracer_xfer_module_bps(BpOpsData* data, PyObject* module) {
  if (module == nullptr || !PyModule_Check(module)) return;
  PyObject* dict = PyModule_GetDict(module);  // borrowed; never fails for a module
  if (dprintf_wanted(kDbgBpFiles)) {
    Ref name = Ref::steal(PyModule_GetNameObject(module));
    if (!name) PyErr_Clear();
    do_dprintf(kDbgBpFiles, "MODNAME %s\n", dprint_check_pystr(name.get()));
    if (dict == nullptr)
      do_dprintf(kDbgBpFiles, "MDICT IS NULL for %s\n", dprint_check_pystr(name.get()));
  }
  if (dict == nullptr || !data->file_key) return;
  PyObject* file = PyDict_GetItemWithError(dict, data->file_key.get());  // borrowed
  if (file == nullptr && PyErr_Occurred() != nullptr) PyErr_Clear();
  do_dprintf(kDbgBpFiles, "XFER %s\n", dprint_check_pystr(file));
  const char* text =
      file != nullptr && PyUnicode_Check(file) ? _pystring_to_c_string(file) : nullptr;
  if (text == nullptr) {
    do_dprintf(kDbgBpFiles, "********** NO FILE NAME ****************\n");
    return;
  }
  __tracer_resolve_bp_filenames(data, text);
}
