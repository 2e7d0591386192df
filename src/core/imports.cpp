// imports.cpp: the import hook and module registry (see imports.h).
#include "core/imports.h"

#include <cerrno>
#include <cstring>

#include "bp/bpops.h"
#include "core/install.h"
#include "core/sublang.h"
#include "core/tracercore.h"
#include "names/conames.h"
#include "support/dbgcommon.h"
#include "support/dprintf.h"
#include "support/pycompat.h"
#include "threads/threadops.h"

namespace {

// The builtins dictionary that the calling thread's code looks __import__ up in: that of its
// innermost frame, or the builtins module's when no frame runs (an embedding application
// calling init from C). Borrowed for as long as the interpreter lives.
PyObject* builtins_for_hook() {
  Ref frame = compat::tstate_frame(compat::current_tstate());
  while (frame && !compat::is_plain_frame(frame.get())) frame = frame_back(frame.get());
  if (frame) {
    Ref builtins = Ref::steal(PyFrame_GetBuiltins(reinterpret_cast<PyFrameObject*>(frame.get())));
    return builtins.get();  // the frame's builtins dictionary outlives this reference
  }
  do_dprintf(kDbgFlow, "Did not install __import__ hook: no PyFrame found\n");
  return PyEval_GetBuiltins();
}

// The function placed into the builtins: the module's __import__, shown as the builtins
// module's own function (its __self__ and __module__), as the interpreter's __import__ is. A
// program that inspects it sees what it would see untraced. New reference, or null with the
// error set.
Ref hook_of_the_builtins(PyObject* method, PyObject* module_name) {
  PyMethodDef* def = compat::method_def_of(method);
  if (def == nullptr) return Ref::borrow(method);  // a stand-in of an embedding: as it is
  Ref builtins = Ref::steal(PyImport_ImportModule("builtins"));
  if (!builtins) return Ref();
  return Ref::steal(PyCFunction_NewEx(def, builtins.get(), module_name));
}

// 1 when `candidate` (the default import given to init) is the replacement itself, in any
// of its forms (the module's method, a hook installed before): it would call itself forever.
// -1 with the error set.
int is_our_import(PyObject* method, PyObject* candidate) {
  PyMethodDef* def = compat::method_def_of(method);
  if (def == nullptr) return PyObject_RichCompareBool(method, candidate, Py_EQ);
  return compat::method_def_of(candidate) == def ? 1 : 0;
}

// Nothing the hook does after the import is traced: the thread's tracing counter is raised
// for the scope.
class UntracedScope {
 public:
  explicit UntracedScope(bool active) : ts_(active ? compat::current_tstate() : nullptr) {
    if (ts_ != nullptr) compat::tracing_add(ts_, 1);
  }
  ~UntracedScope() {
    if (ts_ != nullptr) compat::tracing_add(ts_, -1);
  }
  UntracedScope(const UntracedScope&) = delete;
  UntracedScope& operator=(const UntracedScope&) = delete;

 private:
  PyThreadState* ts_;
};

// A thread first seen at an import (it started untraced) is traced from then on. Only a
// thread the core has never seen: one whose tracing was switched off (a failed callback, a
// thread policy) has a record and stays untraced.
void trace_thread_seen_at_import() {
  PyThreadState* ts = compat::current_tstate();
  if (ts == nullptr || compat::tstate_tracefunc(ts) != nullptr) return;
  if (find_thread_data(&gSelf.thread_table, ts) != nullptr) return;
  install_tracer_into_frames(ts);
  set_global_trace_function(1);
}

bool is_module_code_name(PyObject* name) {
  const char* text = name != nullptr ? _pystring_to_c_string(name) : nullptr;
  return text != nullptr && (std::strcmp(text, "<module>") == 0 || std::strcmp(text, "?") == 0);
}

bool is_pseudo_path(const char* path) {
  size_t length = std::strlen(path);
  return length > 0 && path[0] == '<' && path[length - 1] == '>';
}

// The set of the paths in the new-imports list, made when the list first reaches its limit
// and kept up to date from then on (until the list is handed over). Borrowed, or null with
// an error pending.
PyObject* listed_paths() {
  if (!gSelf.new_imports_listed) {
    gSelf.new_imports_listed = Ref::steal(PySet_New(gSelf.new_imports.get()));
  }
  return gSelf.new_imports_listed.get();
}

// Appends an executed module's path to the new-imports list; past the list's limit only a
// path not listed yet. 0, or -1 with an error pending.
int append_new_import(PyObject* path) {
  PyObject* list = gSelf.new_imports.get();
  if (PyList_GET_SIZE(list) >= kNewImportsKeepEveryExecution) {
    PyObject* listed = listed_paths();
    if (listed == nullptr) return -1;
    int known = PySet_Contains(listed, path);
    if (known != 0) {
      if (known > 0) do_dprintf(kDbgFlow, "MODULE LIST FULL: ALREADY LISTED\n");
      return known > 0 ? 0 : -1;
    }
    if (PySet_Add(listed, path) != 0) return -1;
  }
  if (PyList_Append(list, path) != 0) return -1;
  do_dprintf(kDbgFlow, "ADDED TO MODULE LIST\n");
  return 0;
}

}  // namespace

void __tracer_install_import_hook() {
  TracerState& s = gSelf;
  do_dprintf(kDbgFlow, "********************* INSTALLING TRACE HOOK ***********************\n");
  if (s.installed_import_hook) {
    do_dprintf(kDbgFlow, "NOT INSTALLING TRACE HOOK\n");
    return;
  }
  Ref method = Ref::steal(PyObject_GetAttrString(s.module.get(), "__import__"));
  if (!method) return;
  Ref module_name = Ref::steal(gPtrTo_PyUnicode_FromString("builtins"));
  if (!module_name || PyObject_SetAttrString(method.get(), "__module__", module_name.get()) != 0) {
    return;
  }
  Ref hook = hook_of_the_builtins(method.get(), module_name.get());
  if (!hook) return;
  int same = s.default_import ? is_our_import(method.get(), s.default_import.get()) : 0;
  if (same < 0) return;
  if (same) {
    PyErr_SetString(PyExc_AssertionError,
                    "The default import hook cannot be equal to our import hook");
    return;
  }
  s.installed_import_hook = hook;
  PyObject* builtins = builtins_for_hook();
  if (builtins == nullptr || PyDict_SetItemString(builtins, "__import__", hook.get()) != 0) {
    s.installed_import_hook.reset();
    return;
  }
  do_dprintf(kDbgFlow,
             "********************* DONE INSTALLING TRACE HOOK ***********************\n");
}

PyObject* _tracer_import_hook(PyObject*, PyObject* args, PyObject* kwargs) {
  int saved_errno = errno;
  TracerState& s = gSelf;
  ++s.import_hook_calls;
  if (s.trace_started) trace_thread_seen_at_import();
  if (!s.default_import) {
    PyErr_SetString(PyExc_RuntimeError, "init must be called before __import__");
    return nullptr;
  }
  // The default import is held for the call: an import_cb may re-initialise the core.
  Ref default_import = s.default_import;
  ++s.import_hook_depth;
  Ref result = Ref::steal(PyObject_Call(default_import.get(), args, kwargs));
  --s.import_hook_depth;
  if (s.trace_started) {
    UntracedScope untraced(true);
    if (result) {
      __tracer_xfer_module_bps(&s.bp_ops_data, result.get());
      __call_import_cb(result.get());
    } else {
      do_dprintf(kDbgFlow, "IMPORT HOOK returning NULL\n");
      DLOGEXCEPTION();
      do_dprintf(kDbgFlow, "\n");
    }
  }
  errno = saved_errno;
  return result.release();
}

void __call_import_cb(PyObject* module) {
  TracerState& s = gSelf;
  if (s.in_import_cb || !s.import_cb || s.import_cb.is_none()) return;
  Ref args = Ref::steal(PyTuple_Pack(1, module));
  if (!args) {
    PyErr_Clear();
    return;
  }
  Ref callback = s.import_cb;  // the callback may replace itself
  s.in_import_cb = 1;
  // The program's import must not see what the server side's callback raised: its error is
  // logged and dropped, and the import's own result stands.
  compat::PendingError saved;
  saved.fetch();
  Ref result = Ref::steal(PyObject_Call(callback.get(), args.get(), nullptr));
  if (!result) {
    DLOGEXCEPTION();
    PyErr_Clear();
  }
  // Imports bring new key functions: the active hook's key frames are read again.
  ThreadData* data = find_thread_data(&s.thread_table, compat::current_tstate());
  if (data != nullptr && data->sub_language_hook) {
    PinnedThreadData pin(data);
    Ref hook = data->sub_language_hook;
    __tracer_load_sub_language_frames(hook.get());
  }
  saved.restore();
  s.in_import_cb = 0;
}

const char* register_module_direct(PyObject* module) {
  __call_import_cb(module);
  PyObject* dict = PyModule_Check(module) ? PyModule_GetDict(module) : nullptr;  // borrowed
  const char* path =
      dict != nullptr ? __resolve_module_full_path(&gSelf.co_pathname_table, dict, nullptr, nullptr)
                      : nullptr;
  __tracer_xfer_module_bps(&gSelf.bp_ops_data, module);
  return path;
}

void initial_module_scan() {
  TracerState& s = gSelf;
  if (!s.sys_module) return;
  Ref modules = Ref::steal(PyObject_GetAttrString(s.sys_module.get(), "modules"));
  Ref values =
      modules && PyDict_Check(modules.get()) ? Ref::steal(PyDict_Values(modules.get())) : Ref();
  if (!values) {
    PyErr_Clear();
  } else {
    do_dprintf(kDbgFlow, "INITIAL MODULE SCAN: %i PREVIOUSLY LOADED MODULES",
               static_cast<int>(PyList_GET_SIZE(values.get())));
    for (Py_ssize_t i = 0; i < PyList_GET_SIZE(values.get()); ++i) {
      PyObject* module = PyList_GET_ITEM(values.get(), i);
      if (PyModule_Check(module)) register_module_direct(module);
    }
  }
  Ref argv = Ref::steal(PyObject_GetAttrString(s.sys_module.get(), "argv"));
  if (!argv || !PyList_Check(argv.get()) || PyList_GET_SIZE(argv.get()) == 0) {
    PyErr_Clear();
    return;
  }
  // The main script: breakpoints set in it match before its first line runs.
  const char* path = __resolve_module_full_path(&s.co_pathname_table, nullptr,
                                                PyList_GET_ITEM(argv.get(), 0), nullptr);
  if (path != nullptr) __tracer_resolve_bp_filenames(&s.bp_ops_data, path);
  PyErr_Clear();
}

int __tracer_top_level_call(PyObject* frame) {
  if (!compat::is_plain_frame(frame)) return 0;
  auto* f = reinterpret_cast<PyFrameObject*>(frame);
  Ref code = Ref::steal(reinterpret_cast<PyObject*>(PyFrame_GetCode(f)));
  COPathnameTable* table = &gSelf.co_pathname_table;
  if (LookupCOPathname(table, code.get()) == nullptr) {
    if (PyErr_Occurred() != nullptr) return -1;
    Ref globals = Ref::steal(PyFrame_GetGlobals(f));
    __resolve_module_full_path(
        table, globals.get(), reinterpret_cast<PyCodeObject*>(code.get())->co_filename, code.get());
  }
  return __tracer_detect_module_reloads(code.get()) == 0 ? 0 : -1;
}

int __tracer_detect_module_reloads(PyObject* code) {
  const char* path = LookupCOPathname(&gSelf.co_pathname_table, code);
  do_dprintf(kDbgFlow, "MODULE RELOAD DETECTION: %s\n", dprint_check_str(path));
  if (path == nullptr && PyErr_Occurred() != nullptr) {
    do_dprintf(kDbgFlow, "Exception occurred in __tracer_detect_module_reloads\n");
    return -1;
  }
  PyObject* name = reinterpret_cast<PyCodeObject*>(code)->co_name;
  if (!is_module_code_name(name)) {
    do_dprintf(kDbgFlow, "NON-BLANK/UNKNOWN CODE NAME: %s\n", dprint_check_pystr(name));
    return 0;
  }
  if (path == nullptr) {
    do_dprintf(kDbgFlow, "NULL FILE NAME\n");
    return 0;
  }
  if (is_pseudo_path(path)) {
    do_dprintf(kDbgFlow, "PSEUDO FILE NAME\n");
    return 0;
  }
  Ref text = Ref::steal(gPtrTo_PyUnicode_FromString(path));
  if (!text || !gSelf.new_imports) return -1;
  return append_new_import(text.get());
}

PyObject* take_new_imports() {
  Ref fresh = Ref::steal(PyList_New(0));
  if (!fresh) return nullptr;
  Ref current = gSelf.new_imports ? gSelf.new_imports : Ref::steal(PyList_New(0));
  if (!current) return nullptr;
  gSelf.new_imports = fresh;
  gSelf.new_imports_listed.reset();
  return current.release();
}
