// vantrelmodule.cpp: the module object tvantrel30pydebugstackless: load order, the method
// table and the lifecycle methods init, reset and destroy. Every method is a thin wrapper;
// the behaviour lives in the subsystem that the wrapper calls.
#include <Python.h>

#include <cstdio>
#include <cstring>

#include <pthread.h>

#include "core/dispatch.h"
#include "core/idleticker.h"
#include "core/monitoring.h"
#include "core/tracercore.h"
#include "exc/handlers.h"
#include "module/methods.h"
#include "support/dbgcommon.h"
#include "support/dprintf.h"
#include "support/pycompat.h"
#include "threads/threadops.h"

namespace {
PyObject* gModuleSelf = nullptr;  // owned for the life of the process

bool check_init_arguments(PyObject* const* callbacks, PyObject* import_cb, PyObject* default_import,
                          PyObject* internal_modules_map) {
  static const char* const kCallbackErrors[] = {"install_thread_hooks_cb must be callable",
                                                "idle_cb must be callable",
                                                "line_cb must be callable",
                                                "return_cb must be callable",
                                                "exception_cb must be callable",
                                                "quit_cb must be callable"};
  for (int i = 0; i < 6; ++i) {
    if (!PyCallable_Check(callbacks[i])) {
      PyErr_SetString(PyExc_TypeError, kCallbackErrors[i]);
      return false;
    }
  }
  if (import_cb != Py_None && !PyCallable_Check(import_cb)) {
    PyErr_SetString(PyExc_TypeError, "import_cb must be None or callable");
    return false;
  }
  if (!PyCallable_Check(default_import)) {
    PyErr_SetString(PyExc_TypeError, "default_import must be callable");
    return false;
  }
  if (!PyDict_Check(internal_modules_map)) {
    PyErr_SetString(PyExc_TypeError, "internal_modules_map must be a dict");
    return false;
  }
  return true;
}

// Our own hook given as the default import would make every import call itself for ever.
// Installing the hook refuses it, but only after init has stored the callbacks; refused here
// too, before anything changes, so a server side that made this mistake loses nothing.
bool default_import_is_not_our_hook(PyObject* default_import) {
  Ref hook = Ref::steal(PyObject_GetAttrString(gModuleSelf, "__import__"));
  if (!hook) {
    PyErr_Clear();
    return true;
  }
  // Any function made from the same method definition is ours: the one installed into the
  // builtins is the builtins module's, not this module's.
  PyMethodDef* ours = compat::method_def_of(hook.get());
  if (ours == nullptr || compat::method_def_of(default_import) != ours) return true;
  PyErr_SetString(PyExc_AssertionError,
                  "The default import hook cannot be equal to our import hook");
  return false;
}
}  // namespace

PyObject* _tracer_init(PyObject*, PyObject* args) {
  do_dprintf(kDbgFlow, "STARTING VANTREL INIT\n");
  fflush(stdout);
  fflush(stderr);
  float idle_period = 0;
  int exception_mode = 0;
  PyObject* cbs[6];
  PyObject *import_cb, *default_import, *dprintf_file, *internal_modules_map;
  if (!PyArg_ParseTuple(args, "fiOOOOOOOOOO:tracer_init", &idle_period, &exception_mode, &cbs[0],
                        &cbs[1], &cbs[2], &cbs[3], &cbs[4], &cbs[5], &import_cb, &default_import,
                        &dprintf_file, &internal_modules_map)) {
    return nullptr;
  }
  // Where events come from is an environment setting, refused before anything changes.
  int event_source = kEventsFromTrace;
  if (!check_init_arguments(cbs, import_cb, default_import, internal_modules_map) ||
      !default_import_is_not_our_hook(default_import) ||
      read_event_source_setting(&event_source) != 0) {
    return nullptr;
  }
  gSelf.requested_event_source = static_cast<EventSource>(event_source);
  if (!__tracer_init(gModuleSelf, idle_period, exception_mode, cbs[0], cbs[1], cbs[2], cbs[3],
                     cbs[4], cbs[5], import_cb, default_import, dprintf_file,
                     internal_modules_map)) {
    return nullptr;
  }
  do_dprintf(kDbgFlow, "DONE WITH INIT VANTREL\n");
  Py_RETURN_NONE;
}

PyObject* _tracer_reset(PyObject*, PyObject*) {
  do_dprintf(kDbgFlow, "RESET REACHED\n");
  __tracer_reset();
  Py_RETURN_NONE;
}

PyObject* _tracer_destroy(PyObject*, PyObject*) {
  do_dprintf(kDbgFlow, "DESTROY REACHED\n");
  __tracer_destroy();
  Py_RETURN_NONE;
}

namespace {

#define METHOD(name, fn, doc) \
  {name, reinterpret_cast<PyCFunction>(fn), METH_VARARGS, PyDoc_STR(doc)}

PyMethodDef gMethods[] = {
    METHOD("init", _tracer_init, "initialise the core; must come first"),
    METHOD("reset", _tracer_reset, "reset the core to its blank initial state"),
    METHOD("destroy", _tracer_destroy, "clear all state and restore the environment"),
    METHOD("set_autoquit", _tracer_set_autoquit,
           "0 keeps the debug connection when the bottom frame is left (embedded scripting)"),
    METHOD("set_idle_period", _tracer_set_idle_period, "seconds between idle callbacks"),
    METHOD("set_debug_all_threads", _tracer_set_debug_all_threads,
           "1 debug all threads; 0 only one thread at a time, ignoring the others while one is "
           "stopped"),
    METHOD("set_debug_thread_cb", _tracer_set_debug_thread_cb,
           "per-thread decision callback (0 ignore, 1 stop with the others, 2 stop only at "
           "breakpoint or exception)"),
    METHOD("start_trace", _tracer_start_trace,
           "install the trace function globally and in all frames"),
    METHOD("stop_trace", _tracer_stop_trace, "remove the trace function, stop debugging"),
    METHOD("step_into", _tracer_step_into,
           "step into the next function or to the next instruction"),
    METHOD("step_over", _tracer_step_over, "step over the next instruction"),
    METHOD("step_over_line", _tracer_step_over_line, "step over the current line"),
    METHOD("step_over_line_range", _tracer_step_over_line_range,
           "step over the given range of lines"),
    METHOD("step_out", _tracer_step_out, "step out of the current frame"),
    METHOD("continue_run", _tracer_continue_run, "run freely to the next breakpoint"),
    METHOD("stop", _tracer_stop, "stop at the next reached location"),
    METHOD("get_threads", _tracer_get_threads, "ids of all threads known to the core"),
    METHOD("get_curr_frame", _tracer_get_curr_frame, "the frame where the thread stopped"),
    METHOD("get_thread_name", _tracer_get_thread_name, "name of the thread's main function"),
    METHOD("is_botframe", _tracer_is_botframe,
           "whether the frame is the bottom frame of the calling thread"),
    METHOD("get_tracing", get_tracing, "whether tracing is active in any thread"),
    METHOD("set_break", _tracer_set_break,
           "Set a breakpoint at given file/line.  Pass in file, line, enabled flag,\ntemporary "
           "flag, conditional as string (or None), and ignore count.  If\na breakpoint exists, "
           "its values will be updated accordingly.  The new breakpoint\nid is returned as int."),
    METHOD("clear_breaks", _tracer_clear_breaks, "Clear all breakpoints at given file/line"),
    METHOD("enable_breaks", _tracer_enable_breaks,
           "Enable/disable all breakpoints at given file and line number"),
    METHOD("ignore_breaks", _tracer_ignore_breaks,
           "Ignore all breakpoints at given file and line number for a given number\nof hits"),
    METHOD("set_breaks_cond", _tracer_set_breaks_cond,
           "Set conditional for all breakpoints at given file and line number; empty string to "
           "set no conditional"),
    METHOD("clear_all_breaks", _tracer_clear_all_breaks, "Clear all defined breakpoints"),
    METHOD("get_breaks", _tracer_get_breaks,
           "Get all breakpoints at given file and line number: Returns sequence of\n(id, "
           "enabled, temporary, cond, ignore_count, hit_count) tuples"),
    METHOD("get_file_breaks", _tracer_get_file_breaks,
           "Get all breakpoints in given file: Returns sequence of (lineno, id\nenabled, "
           "temporary, cond, ignore_count, hit_count) tuples"),
    METHOD("set_exception_mode", _tracer_set_exception_mode,
           "Set exception mode to use : One of kExcNeverStop=0 to never stop\non exceptions, "
           "kExcAlwaysStop=1 to always stop on exceptions,\nor kExcUnhandledStop=2 to only stop "
           "on unhandled exceptions.\n"),
    METHOD("get_exception_mode", _tracer_get_exception_mode,
           "Get exception mode in use : One of kExcNeverStop=0 to never stop\non exceptions, "
           "kExcAlwaysStop=1 to always stop on exceptions,\nor kExcUnhandledStop=2 to only stop "
           "on unhandled exceptions.\n"),
    METHOD("ignore_exception_loc", _tracer_ignore_exception_loc,
           "Ignore/un-ignore future exceptions at given file, lineno (filename must be as "
           "given\nin the reported exception)"),
    METHOD("exception_loc_ignored", _tracer_exception_loc_ignored,
           "Check whether exceptions at given file / line number are being ignored bythe "
           "debugger"),
    METHOD("clear_exception_ignores", _tracer_clear_exception_ignores,
           "Clear exception ignores list to blank"),
    METHOD("exiting_on_exception", _tracer_exiting_on_exception,
           "Returns true when the debugger core has seen an unhandled exception at the\nbottom "
           "frame, and thus any further stepping, etc, will cause the program\nto exit.  This "
           "is used to make sure we close the client connection cleanly\nin all cases.  Note "
           "that this always returns false when autoquit is off\nsince the exception won't "
           "cause exit in an embedded environment."),
    METHOD("set_always_stop_excepts", set_always_stop_excepts,
           "Set the tuple of exception types to always stop on"),
    METHOD("get_always_stop_excepts", get_always_stop_excepts,
           "Get the tuple of exception types to always stop on"),
    METHOD("set_never_stop_excepts", set_never_stop_excepts,
           "Set the tuple of exception types to never stop on"),
    METHOD("get_never_stop_excepts", get_never_stop_excepts,
           "Get the tuple of exception types to never stop on"),
    METHOD("set_ignored_exception_handlers", set_ignored_exception_handlers,
           "Sets the dictionary of ignored handlers.  Keys may be either frame or code objects "
           "to ignore"),
    METHOD("set_exc_catch_info_list", set_exc_catch_info_list,
           "Set list of exception info instances.  Each instance should have co_name, "
           "module_name, prints, ignore, & parent attributes.  Class for these instances is "
           "defined in selvane.py."),
    METHOD("get_new_imports", _tracer_get_new_imports,
           "Used to obtain list of full path names for modules that have been\nloaded or "
           "reloaded since the last call to this function.  Also clears\nthe table of new "
           "loaded/reloaded modules to blank."),
    METHOD("set_import_cb", _tracer_set_import_cb,
           "Set the callback called when a module is imported (may be None)"),
    METHOD("register_module", _tracer_register_module, "Register module with the debugger"),
    METHOD("register_sub_language_hook", _tracer_register_sub_language_hook,
           "Register a sub-language extension with the debugger"),
    METHOD("sub_language_get_active_hook", _tracer_sub_language_get_active_hook,
           "Get the active sub language hook in the given thread.  Returns None\nwhen no "
           "sub-language implementation is active on the thread's stack."),
    METHOD("sub_language_get_frame_category", _tracer_sub_language_get_frame_category,
           "Get the type of the given frame:  Returns 1 if it's a key frame in the "
           "active\nsub-language implementation, 0 if it's a frame that should be hidden "
           "because it\nis part of the sub-language implementation but not a key frame, and -1 "
           "for\nunknown frames."),
    METHOD("add_to_tstate_tracing", add_to_tstate_tracing,
           "Adds given value to tracing field of the current thread state.  The trace function "
           "will be called only if tracing == 0.  value can be < 0."),
    METHOD("get_tstate_tracing", get_tstate_tracing,
           "Returns current value of tracing field of the current thread state.  The trace "
           "function will be called only if tracing == 0."),
    METHOD("set_tstate_use_tracing", set_tstate_use_tracing,
           "Set value of use_tracing field of the current thread state.  The trace & profile "
           "functions will be called only if use_tracing != 0.  The field was add in Python 2.3; "
           "this does nothing in Python 2.0 & 2.1."),
    METHOD("get_tstate_use_tracing", get_tstate_use_tracing,
           "Returns current value of use_tracing field of the current thread state.  The trace & "
           "profile functions will be called only if use_tracing != 0. The field was add in "
           "Python 2.3; this always returns 1 in Python 2.0 & 2.1."),
    METHOD("acquire_selvane_mutex", _tracer_acquire_selvane_mutex,
           "take the mutex that lets only one thread call into the debug server"),
    METHOD("release_selvane_mutex", _tracer_release_selvane_mutex, "release that mutex"),
    METHOD("raise_exception", raise_exception,
           "Raise given exception in the thread at the next opportunity"),
    METHOD("locals_to_fast", locals_to_fast,
           "Call LocalsToFast on given frame so changes made in the frame locals dict get\nput "
           "back into the real locals dict"),
    METHOD("get_frame_file", get_frame_file,
           "Returns the filename associated with the given frame"),
    METHOD("get_current_tstate_id", get_current_tstate_id, "Returns id of current thread state"),
    METHOD("get_thread_ident_for_tstate_id", get_thread_ident_for_tstate_id,
           "Returns id returned by thread.get_ident for given tstate_id"),
    METHOD("is_internal_frame", _tracer_is_internal_frame,
           "Returns id returned by thread.get_ident for given tstate_id"),
    METHOD("get_changed_bps_lists", get_changed_bps_lists, "Gets and clears the changed bp lists."),
    METHOD("WaitForInput", WrapWaitForInput,
           "Wait until input is available on either the given file object or the socket file "
           "descriptor.  Returns -1 if it was unable to wait for any reason (e.g. if arg 1 is "
           "not a PyFileObject or an internal error occurs), 0 if input on the debug connection "
           "is available, or the number of bytes that can safely be read  for the file object."),
    METHOD("CopyIntoBuffer", WrapCopyIntoBuffer,
           "Put data into a writable buffer at given offset,  If data is longer than the "
           "remaining buffer space, it is truncated.  Returns # of bytes copied."),
    METHOD("PyFrame_LocalsToFast", wrap_PyFrame_LocalsToFast,
           "Wrapper around PyFrame_LocalsToFast internal api call."),
    // The trace function, the thread hooks and __import__ carry no docstring. __import__
    // carries the interpreter's signature, in the form that leaves __doc__ empty and gives
    // inspect.signature what it gives for the interpreter's own __import__.
    {"trace_dispatch", _tracer_trace_dispatch, METH_VARARGS, nullptr},
    {"bootstrap_new_thread", _tracer_bootstrap_new_thread, METH_VARARGS, nullptr},
    {"thread_exiting", _tracer_thread_exiting, METH_VARARGS, nullptr},
    {"__import__", reinterpret_cast<PyCFunction>(reinterpret_cast<void (*)()>(_tracer_import)),
     METH_VARARGS | METH_KEYWORDS,
     "__import__(name, globals=None, locals=None, fromlist=(), level=0)\n--\n\n"},
    {nullptr, nullptr, 0, nullptr},
};

#undef METHOD

PyModuleDef gModuleDef = {
    PyModuleDef_HEAD_INIT,
    "tvantrel30pydebugstackless",
    nullptr,
    -1,
    gMethods,
    nullptr,
    nullptr,
    nullptr,
    nullptr,
};

// The string makers are looked up by name because their symbol names once depended on the
// interpreter's build (UCS2 or UCS4); the first name defined wins.
template <typename Fn>
Fn lookup_first(const char* const (&names)[3]) {
  for (const char* name : names) {
    if (void* address = lookup_python_function(name)) return reinterpret_cast<Fn>(address);
  }
  return nullptr;
}

}  // namespace

int add_submodule(PyObject* parent, PyModuleDef* def) {
  Ref module = Ref::steal(PyModule_Create2(def, PYTHON_API_VERSION));
  if (!module) return -1;
  const char* dot = std::strrchr(def->m_name, '.');
  const char* name = dot != nullptr ? dot + 1 : def->m_name;
  if (PyModule_AddObjectRef(parent, name, module.get()) != 0) return -1;
  PyObject* modules = PyImport_GetModuleDict();  // borrowed
  return PyDict_SetItemString(modules, def->m_name, module.get());
}

PyMODINIT_FUNC PyInit_tvantrel30pydebugstackless(void) {
  static const char* const kFromString[3] = {"PyUnicodeUCS2_FromString", "PyUnicodeUCS4_FromString",
                                             "PyUnicode_FromString"};
  static const char* const kFormatV[3] = {"PyUnicodeUCS2_FromFormatV", "PyUnicodeUCS4_FromFormatV",
                                          "PyUnicode_FromFormatV"};
  gPtrTo_PyUnicode_FromString = lookup_first<decltype(gPtrTo_PyUnicode_FromString)>(kFromString);
  if (gPtrTo_PyUnicode_FromString == nullptr) {
    PyErr_SetString(PyExc_RuntimeError, "Could not find PyUnicode*_FromString");
    return nullptr;
  }
  gPtrTo_PyUnicode_FormatV = lookup_first<decltype(gPtrTo_PyUnicode_FormatV)>(kFormatV);
  do_dprintf(kDbgFlow, "Initialize vantrel module started\n");
  // Single-phase, state in globals: the module cannot be made twice in one process.
  if (gModuleSelf != nullptr) return Py_NewRef(gModuleSelf);
  gModuleSelf = PyModule_Create2(&gModuleDef, PYTHON_API_VERSION);
  if (gModuleSelf == nullptr) return nullptr;
  if (add_breakpoints_module(gModuleSelf) != 0) {
    Py_CLEAR(gModuleSelf);
    return nullptr;
  }
  init_threadops();
  init_tracercore();
  // The handler analysis reads the interpreter's opcode tables now, never inside an event;
  // when they cannot be read it answers "not caught" everywhere.
  init_handler_analysis();
  if (add_analysis_module(gModuleSelf) != 0) {
    Py_CLEAR(gModuleSelf);
    return nullptr;
  }
  // A ticker that keeps the idle callback going under sys.monitoring must end before the
  // interpreter finalises.
  init_idle_ticker();
  // A forked child is never traced; the handler only sets a flag that the next event reads.
  pthread_atfork(nullptr, nullptr, note_fork_in_child);
  do_dprintf(kDbgFlow, "Initialize vantrel module complete\n");
  return Py_NewRef(gModuleSelf);
}
