// codefile.cpp: from a code object, its module's globals or a frame to a file name
// (declared in conames.h).
//
// A code object's co_filename may be stale (the package moved since it was compiled) or a
// compiled file's recorded source; the module's __file__ is preferred then. Frames are
// answered from the pathname table first: a hit costs one index probe and no allocation, as
// this runs on every line event that needs a file name.

#include <cctype>
#include <cstdlib>
#include <cstring>

#include "names/conames.h"
#include "support/dbgcommon.h"
#include "support/dprintf.h"
#include "support/pycompat.h"

namespace {

// What a file name that is too long to keep becomes.
constexpr const char kTooLongName[] = "<filename too long>";

bool ends_in_compiled_suffix_char(const char* name) {
  const size_t length = std::strlen(name);
  if (length == 0) return false;
  const int last = std::tolower(static_cast<unsigned char>(name[length - 1]));
  return last == 'c' || last == 'o';
}

// Same modification second and same size: the compiled file `globals_file` was made from a
// copy of `co_filename`. Both stats come from the cache, like every stat of file names.
bool same_mtime_and_size(FileOpsData* file_ops, const char* globals_file, const char* co_filename) {
  // A heap copy: this runs in trace functions, whose threads may have small stacks.
  char* source = strdup(globals_file);
  if (source == nullptr) return false;
  prune_py_c_or_o(source);
  const struct stat* source_stat = __tracer_stat(file_ops, source);
  const struct stat* code_stat = __tracer_stat(file_ops, co_filename);
  const bool same = source_stat != nullptr && code_stat != nullptr &&
                    source_stat->st_mtime == code_stat->st_mtime &&
                    source_stat->st_size == code_stat->st_size;
  std::free(source);
  return same;
}

// __file__ is a compiled file whose source is the same file as co_filename under another
// directory (a tree that was copied or moved after compiling).
bool globals_file_is_compiled_copy(FileOpsData* file_ops, const char* globals_file,
                                   const char* co_filename) {
  return std::strlen(globals_file) < kMaxPathLen && ends_in_compiled_suffix_char(globals_file) &&
         py_names_equiv(find_basename(globals_file), find_basename(co_filename)) &&
         same_mtime_and_size(file_ops, globals_file, co_filename);
}

// The text of globals["__file__"] when it is exactly a str, else null (no error pending).
const char* globals_file_text(COPathnameTable* table, PyObject* globals) {
  if (globals == nullptr || !PyDict_Check(globals) || !table->file_key) return nullptr;
  PyObject* file = PyDict_GetItemWithError(globals, table->file_key.get());  // borrowed
  if (file == nullptr) {
    if (PyErr_Occurred()) PyErr_Clear();
    return nullptr;
  }
  return PyUnicode_CheckExact(file) ? _pystring_to_c_string(file) : nullptr;
}

// Names such as "<string>" or "<stdin>" stand for no file.
bool is_pseudo_file_name(const char* name) {
  const size_t length = std::strlen(name);
  return length > 0 && name[0] == '<' && name[length - 1] == '>';
}

}  // namespace

int use_globals_name(FileOpsData* file_ops, const char* globals_file, const char* co_filename) {
  if (globals_file == nullptr) return 0;
  if (co_filename == nullptr) return 1;
  if (py_names_equiv(globals_file, co_filename)) return 0;
  // "Cannot be read" is asked of the stat cache: a file that cannot be statted cannot be
  // read, and a failed stat is remembered briefly, so a module whose co_filename is stale
  // costs no system call per lookup. (A file that exists but denies reading counts as
  // readable here; the interpreter could not have compiled it from there either way.)
  if (__tracer_stat(file_ops, co_filename) == nullptr) return 1;
  return globals_file_is_compiled_copy(file_ops, globals_file, co_filename) ? 1 : 0;
}

const char* find_codefile(COPathnameTable* table, PyObject* globals, PyObject* co_filename) {
  const char* globals_file = globals_file_text(table, globals);
  const char* code_file = co_filename != nullptr && PyUnicode_CheckExact(co_filename)
                              ? _pystring_to_c_string(co_filename)
                              : nullptr;
  // Code compiled from a string stays "<string>", whatever module it runs in.
  if (code_file != nullptr && std::strcmp(code_file, "<string>") == 0) return code_file;
  if (use_globals_name(table->file_ops, globals_file, code_file)) return globals_file;
  if (code_file == nullptr) return "<string>";
  return code_file;
}

const char* __tracer_get_relative_path(COPathnameTable* table, PyObject* globals,
                                       PyObject* co_filename) {
  do_dprintf(kDbgPathnames, "get_relative_path(globals = %p, co_filename = %s)\n", globals,
             dprint_check_pystr(co_filename));
  const char* found = find_codefile(table, globals, co_filename);
  size_t length = std::strlen(found);
  if (length > kMaxPathLen) {
    do_dprintf(kDbgPathnames, "FAILURE: File name too long: %s\n", kTooLongName);
    found = kTooLongName;
    length = sizeof kTooLongName - 1;
  }
  std::memcpy(table->path_buffer, found, length + 1);
  prune_py_c_or_o(table->path_buffer);
  return table->path_buffer;
}

const char* __tracer_get_full_path(COPathnameTable* table, PyObject* frame) {
  if (frame == nullptr) return nullptr;
  if (!compat::is_plain_frame(frame)) return "<cframe>";
  auto* plain_frame = reinterpret_cast<PyFrameObject*>(frame);
  Ref code = Ref::steal(reinterpret_cast<PyObject*>(PyFrame_GetCode(plain_frame)));
  auto* code_fields = reinterpret_cast<PyCodeObject*>(code.get());
  const char* registered = LookupCOPathname(table, code.get());
  if (dprintf_wanted(kDbgPathnames)) {
    do_dprintf(kDbgPathnames, "LookupCOPathname(%s) => %s\n",
               dprint_check_pystr(code_fields->co_name), dprint_check_str(registered));
  }
  if (registered != nullptr) return registered;
  if (PyErr_Occurred()) {
    PyErr_Clear();
    return nullptr;
  }
  Ref globals = Ref::steal(PyFrame_GetGlobals(plain_frame));
  const char* relative = __tracer_get_relative_path(table, globals.get(), code_fields->co_filename);
  const char* full = get_absname(table->file_ops, relative);
  if (full == nullptr) {
    do_dprintf(kDbgPathnames, "No full name found for relative name %s\n",
               dprint_check_str(relative));
    return relative;
  }
  return full;
}

const char* __resolve_module_full_path(COPathnameTable* table, PyObject* globals,
                                       PyObject* co_filename, PyObject* code) {
  const char* relative = __tracer_get_relative_path(table, globals, co_filename);
  do_dprintf(kDbgPathnames, "resolving %s\n", dprint_check_str(relative));
  if (is_pseudo_file_name(relative)) return nullptr;
  const char* full = get_absname(table->file_ops, relative);
  do_dprintf(kDbgPathnames, "fullname = %s\n", dprint_check_str(full));
  if (full == nullptr) return nullptr;
  if (code != nullptr) {
    RegisterCOPathname(table, code, full, Py_None, 1);
  } else {
    RegisterMatchingCodeValues(table, full, globals, 0);
  }
  return full;
}
