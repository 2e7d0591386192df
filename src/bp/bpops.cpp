// bpops.cpp: breakpoint records, the breakpoint table and the changed list (see bpops.h).
#include "bp/bpops.h"

#include <cstdlib>
#include <cstring>
#include <new>

#include "names/conames.h"
#include "support/dbgcommon.h"
#include "support/dprintf.h"

namespace {

constexpr int32_t kLineKeySize = sizeof(int32_t);

void set_out_of_memory() {
  PyErr_Clear();
  PyErr_SetString(PyExc_MemoryError, "Out of memory");
}

CU_HashEntry* line_entry(BpOpsData* data, int32_t lineno) {
  return CU_FindHashEntry(&data->bp_table, &lineno);
}

Breakpoint* chain_of(CU_HashEntry* entry) {
  return entry != nullptr ? static_cast<Breakpoint*>(CU_GetHashValue(entry)) : nullptr;
}

bool is_for_file(const Breakpoint* bp, const char* file) {
  return std::strcmp(bp->user_filename, file) == 0;
}

// New str of C text through the interpreter's string maker; None for null text.
Ref text_or_none(const char* text) {
  return text != nullptr ? Ref::steal(gPtrTo_PyUnicode_FromString(text)) : Ref::none();
}

// Calls `change` on every breakpoint of `file` at `lineno`; the number of records changed.
template <typename Change>
int for_each_matching(BpOpsData* data, const char* file, int32_t lineno, Change change) {
  int matched = 0;
  for (Breakpoint* bp = chain_of(line_entry(data, lineno)); bp != nullptr; bp = bp->next_at_line) {
    if (!is_for_file(bp, file)) continue;
    change(bp);
    ++matched;
  }
  return matched;
}

// Frees a record that the tables may have handed out.
void discard_bp(BpOpsData* data, Breakpoint* bp) {
  ++data->free_count;
  __tracer_free_bp(bp);
}

void init_bp_table(BpOpsData* data) {
  CU_InitHashTable(&data->bp_table, kLineKeySize);
}

}  // namespace

namespace {

void make_bp_tables(BpOpsData* data, COPathnameTable* co_pathname_table) {
  init_bp_table(data);
  data->changed_head = nullptr;
  data->next_id = 1;
  CU_InitHashTable(&data->loaded_modules, 0);
  data->co_pathname_table = co_pathname_table;
  data->file_ops = co_pathname_table != nullptr ? co_pathname_table->file_ops : nullptr;
  data->file_key = Ref::steal(gPtrTo_PyUnicode_FromString("__file__"));
  if (!data->file_key) PyErr_Clear();
}

void release_bp_tables(BpOpsData* data) {
  __tracer_clear_all_breaks(data);
  // Records that fired as temporary breakpoints and wait on the changed list belong to the
  // session that ends here.
  __tracer_clear_changed_bps(data);
  __tracer_clear_loaded_modules(data);
  // Deleted rather than initialised over, so that grown bucket arrays are freed.
  CU_DeleteHashTable(&data->bp_table);
  CU_DeleteHashTable(&data->loaded_modules);
}

}  // namespace

void __tracer_init_bp_ops_data(BpOpsData* data, COPathnameTable* co_pathname_table) {
  // A repeated init finds the tables of the earlier session: they are emptied, not lost.
  if (data->bp_table.buckets != nullptr) release_bp_tables(data);
  make_bp_tables(data, co_pathname_table);
}

void __tracer_clear_bp_ops_data(BpOpsData* data, COPathnameTable* co_pathname_table) {
  release_bp_tables(data);
  // Ids start at 1 again.
  make_bp_tables(data, co_pathname_table);
}

// ---- Records ------------------------------------------------------------------------------

Breakpoint* __tracer_create_bp(BpOpsData* data, const char* file, int lineno, int enabled,
                               int temporary, PyObject* cond, int ignore_count) {
  int32_t id = data->next_id++;
  auto* bp = new (std::nothrow) Breakpoint{};
  if (bp == nullptr) return nullptr;
  bp->id = id;
  bp->lineno = lineno;
  bp->enabled = static_cast<int16_t>(enabled);
  bp->temporary = static_cast<int16_t>(temporary);
  bp->ignore_count = ignore_count;
  bp->user_filename = strdup(file);
  bool cond_ok = cond == Py_None || (bp->cond = _pystring_to_c_string_copy(cond)) != nullptr;
  if (bp->user_filename == nullptr || !cond_ok) {
    __tracer_free_bp(bp);
    return nullptr;
  }
  return bp;
}

void __tracer_free_bp(Breakpoint* bp) {
  if (bp == nullptr) return;
  std::free(bp->user_filename);
  std::free(bp->module_filename);
  std::free(bp->cond);
  delete bp;
}

int __tracer_add_userbp(BpOpsData* data, Breakpoint* bp) {
  int is_new = 0;
  CU_HashEntry* entry = CU_CreateHashEntry(&data->bp_table, &bp->lineno, &is_new);
  if (entry == nullptr) return 0;
  bp->next_at_line = chain_of(entry);
  CU_SetHashValue(entry, bp);
  return 1;
}

void __tracer_del_userbp(BpOpsData* data, Breakpoint* bp) {
  CU_HashEntry* entry = line_entry(data, bp->lineno);
  if (entry == nullptr) return;
  Breakpoint* head = chain_of(entry);
  if (head == bp) {
    head = bp->next_at_line;
  } else {
    for (Breakpoint* prev = head; prev != nullptr; prev = prev->next_at_line) {
      if (prev->next_at_line != bp) continue;
      prev->next_at_line = bp->next_at_line;
      break;
    }
  }
  bp->next_at_line = nullptr;
  if (head == nullptr) {
    CU_DeleteHashEntry(entry);
  } else {
    CU_SetHashValue(entry, head);
  }
}

Breakpoint* __tracer_bps_at_line(BpOpsData* data, int32_t lineno) {
  // No breakpoint anywhere: not even the hash of the line is worked out.
  if (data->bp_table.num_entries == 0) return nullptr;
  return chain_of(line_entry(data, lineno));
}

// ---- The changed list -----------------------------------------------------------------------

void __tracer_add_changed_bp(BpOpsData* data, Breakpoint* bp) {
  if (bp->on_changed_list) return;
  bp->on_changed_list = 1;
  bp->next_changed = data->changed_head;
  data->changed_head = bp;
}

void __tracer_remove_bp_from_changed(BpOpsData* data, Breakpoint* bp) {
  if (!bp->on_changed_list) return;
  Breakpoint** link = &data->changed_head;
  while (*link != nullptr && *link != bp) link = &(*link)->next_changed;
  if (*link == bp) *link = bp->next_changed;
  bp->next_changed = nullptr;
  bp->on_changed_list = 0;
}

void __tracer_clear_changed_bps(BpOpsData* data) {
  Breakpoint* bp = data->changed_head;
  data->changed_head = nullptr;
  while (bp != nullptr) {
    Breakpoint* next = bp->next_changed;
    bp->next_changed = nullptr;
    bp->on_changed_list = 0;
    if (bp->deleted) discard_bp(data, bp);
    bp = next;
  }
}

PyObject* __tracer_python_bp_data(const Breakpoint* bp) {
  Ref file = text_or_none(bp->user_filename);
  Ref cond = text_or_none(bp->cond);
  PyObject* tuple = file && cond ? Py_BuildValue("(OiiiiOii)", file.get(), bp->lineno, bp->id,
                                                 bp->enabled ? 1 : 0, bp->temporary ? 1 : 0,
                                                 cond.get(), bp->ignore_count, bp->hit_count)
                                 : nullptr;
  if (tuple == nullptr) set_out_of_memory();
  return tuple;
}

PyObject* __tracer_get_changed_bps_lists(BpOpsData* data) {
  Ref deleted = Ref::steal(PyList_New(0));
  Ref changed = Ref::steal(PyList_New(0));
  if (!deleted || !changed) {
    set_out_of_memory();
    return nullptr;
  }
  for (Breakpoint* bp = data->changed_head; bp != nullptr; bp = bp->next_changed) {
    Ref item = Ref::steal(bp->deleted ? PyLong_FromLong(bp->id) : __tracer_python_bp_data(bp));
    PyObject* list = bp->deleted ? deleted.get() : changed.get();
    if (!item || PyList_Append(list, item.get()) != 0) {
      set_out_of_memory();
      return nullptr;
    }
  }
  PyObject* lists = PyTuple_Pack(2, deleted.get(), changed.get());
  if (lists == nullptr) {
    set_out_of_memory();
    return nullptr;
  }
  __tracer_clear_changed_bps(data);
  return lists;
}

// ---- The user's operations ----------------------------------------------------------------

int __tracer_set_break(BpOpsData* data, const char* file, int lineno, int enabled, int temporary,
                       PyObject* cond, int ignore_count) {
  Breakpoint* bp = __tracer_create_bp(data, file, lineno, enabled, temporary, cond, ignore_count);
  if (bp == nullptr) {
    set_out_of_memory();
    return -1;
  }
  // A second breakpoint on the same file and line is a further record with its own id, in
  // front of the first: the server side keeps its breakpoints by id.
  bool added = __tracer_add_userbp(data, bp) != 0;
  if (added && __tracer_find_bp_filename_synonyms(data, bp)) return bp->id;
  if (added) __tracer_del_userbp(data, bp);
  __tracer_free_bp(bp);
  set_out_of_memory();
  return -1;
}

void __tracer_clear_breaks(BpOpsData* data, const char* file, int lineno) {
  CU_HashEntry* entry = line_entry(data, lineno);
  if (entry == nullptr) return;
  Breakpoint* kept = nullptr;
  Breakpoint** tail = &kept;
  Breakpoint* bp = chain_of(entry);
  while (bp != nullptr) {
    Breakpoint* next = bp->next_at_line;
    if (is_for_file(bp, file)) {
      __tracer_remove_bp_from_changed(data, bp);
      discard_bp(data, bp);
    } else {
      *tail = bp;
      tail = &bp->next_at_line;
    }
    bp = next;
  }
  *tail = nullptr;
  if (kept == nullptr) {
    CU_DeleteHashEntry(entry);
  } else {
    CU_SetHashValue(entry, kept);
  }
}

int __tracer_enable_breaks(BpOpsData* data, const char* file, int lineno, int flag) {
  int matched = for_each_matching(data, file, lineno,
                                  [flag](Breakpoint* bp) { bp->enabled = flag != 0 ? 1 : 0; });
  // Only enabling reports success; disabling always answers 0, as callers have come to expect.
  return matched > 0 && flag != 0 ? 1 : 0;
}

int __tracer_ignore_breaks(BpOpsData* data, const char* file, int lineno, int count) {
  int matched =
      for_each_matching(data, file, lineno, [count](Breakpoint* bp) { bp->ignore_count = count; });
  return matched > 0 ? 1 : 0;
}

int __tracer_set_breaks_cond(BpOpsData* data, const char* file, int lineno, PyObject* cond) {
  bool failed = false;
  int matched = for_each_matching(data, file, lineno, [cond, &failed](Breakpoint* bp) {
    std::free(bp->cond);
    bp->cond = nullptr;
    bp->compiled.reset();
    // An empty text is a condition too (one that never evaluates), not "no condition".
    if (cond != Py_None && (bp->cond = _pystring_to_c_string_copy(cond)) == nullptr) {
      failed = true;
    }
  });
  if (failed) {
    set_out_of_memory();
    return -1;
  }
  return matched > 0 ? 1 : 0;
}

void __tracer_clear_all_breaks(BpOpsData* data) {
  CU_HashSearch search;
  for (CU_HashEntry* e = CU_FirstHashEntry(&data->bp_table, &search); e != nullptr;
       e = CU_NextHashEntry(&search)) {
    Breakpoint* bp = chain_of(e);
    while (bp != nullptr) {
      Breakpoint* next = bp->next_at_line;
      __tracer_remove_bp_from_changed(data, bp);
      discard_bp(data, bp);
      bp = next;
    }
  }
  CU_DeleteHashTable(&data->bp_table);
  init_bp_table(data);
}

PyObject* __tracer_get_breaks(BpOpsData* data, const char* file, int lineno) {
  Ref list = Ref::steal(PyList_New(0));
  for (Breakpoint* bp = chain_of(line_entry(data, lineno)); list && bp != nullptr;
       bp = bp->next_at_line) {
    if (!is_for_file(bp, file)) continue;
    // A breakpoint without a condition shows None, as in the other listings.
    Ref cond = text_or_none(bp->cond);
    Ref item = cond ? Ref::steal(Py_BuildValue("(iiiOii)", bp->id, bp->enabled ? 1 : 0,
                                               bp->temporary ? 1 : 0, cond.get(), bp->ignore_count,
                                               bp->hit_count))
                    : Ref();
    if (!item || PyList_Append(list.get(), item.get()) != 0) list.reset();
  }
  if (!list) set_out_of_memory();
  return list.release();
}

PyObject* __tracer_get_file_breaks(BpOpsData* data, const char* file) {
  Ref list = Ref::steal(PyList_New(0));
  CU_HashSearch search;
  for (CU_HashEntry* e = CU_FirstHashEntry(&data->bp_table, &search); list && e != nullptr;
       e = CU_NextHashEntry(&search)) {
    for (Breakpoint* bp = chain_of(e); list && bp != nullptr; bp = bp->next_at_line) {
      if (!is_for_file(bp, file)) continue;
      Ref cond = text_or_none(bp->cond);
      Ref item = cond ? Ref::steal(Py_BuildValue("(iiiiOii)", bp->lineno, bp->id,
                                                 bp->enabled ? 1 : 0, bp->temporary ? 1 : 0,
                                                 cond.get(), bp->ignore_count, bp->hit_count))
                      : Ref();
      if (!item || PyList_Append(list.get(), item.get()) != 0) list.reset();
    }
  }
  if (!list) set_out_of_memory();
  return list.release();
}
