// trace_methods.cpp: the methods that switch tracing on and off, the stepping commands
// (called by the server side from inside a callback, for the calling thread), the thread
// start and exit hooks, and raise_exception.
#include <Python.h>

#include "core/monitoring.h"
#include "core/dispatch.h"
#include "core/exception_dispatch.h"
#include "core/install.h"
#include "core/stepping.h"
#include "core/thread_policy.h"
#include "core/tracercore.h"
#include "module/methods.h"
#include "support/dprintf.h"
#include "support/pycompat.h"
#include "threads/threadops.h"

namespace {
// The calling thread's record, made when missing; null with MemoryError set.
ThreadData* calling_thread_record() {
  ThreadData* data = current_thread_data_or_insert(&gSelf.thread_table);
  if (data == nullptr && PyErr_Occurred() == nullptr) {
    PyErr_SetString(PyExc_MemoryError, "Out of memory");
  }
  return data;
}

using StepCommand = void (*)(ThreadData*);

PyObject* run_step_command(StepCommand command) {
  ThreadData* data = calling_thread_record();
  if (data == nullptr) return nullptr;
  command(data);
  Py_RETURN_NONE;
}

// Tracing needs what init stores (the trace function object, the callbacks); before init
// the methods that would start it refuse instead of tracing with null fields.
bool initialised(const char* method) {
  if (gSelf.module && gSelf.trace_dispatch) return true;
  PyErr_Format(PyExc_RuntimeError, "init must be called before %s", method);
  return false;
}
}  // namespace

PyObject* _tracer_start_trace(PyObject*, PyObject*) {
  if (!initialised("start_trace")) return nullptr;
  if (!__tracer_start_trace()) return nullptr;
  Py_RETURN_NONE;
}

PyObject* _tracer_stop_trace(PyObject*, PyObject* args) {
  do_dprintf(kDbgFlow, "STOP TRACE AFTER %i INSTRUCTIONS\n",
             static_cast<int>(gSelf.instruction_count));
  do_dprintf(kDbgFlow, "%i IMPORT HOOK CALLS WERE MADE\n",
             static_cast<int>(gSelf.import_hook_calls));
  do_dprintf(kDbgFlow, "%i UNIQUE IMPORTS WERE MADE\n", gSelf.bp_ops_data.unique_import_count);
  if (!PyArg_ParseTuple(args, ":tracer_stop_trace")) return nullptr;
  __tracer_stop_trace();
  Py_RETURN_NONE;
}

PyObject* _tracer_step_into(PyObject*, PyObject*) {
  return run_step_command(__tracer_step_into);
}
PyObject* _tracer_step_over(PyObject*, PyObject*) {
  return run_step_command(__tracer_step_over);
}
PyObject* _tracer_step_over_line(PyObject*, PyObject*) {
  return run_step_command(__tracer_step_over_line);
}
PyObject* _tracer_continue_run(PyObject*, PyObject*) {
  return run_step_command(__tracer_continue_run);
}
PyObject* _tracer_stop(PyObject*, PyObject*) {
  return run_step_command(__tracer_stop);
}

PyObject* _tracer_step_over_line_range(PyObject*, PyObject* args) {
  ThreadData* data = calling_thread_record();
  if (data == nullptr) return nullptr;
  int first = 0, last = 0;
  if (!PyArg_ParseTuple(args, "ii", &first, &last)) return nullptr;
  __tracer_step_over_line_range(data, first, last);
  Py_RETURN_NONE;
}

PyObject* _tracer_step_out(PyObject*, PyObject*) {
  ThreadData* data = calling_thread_record();
  if (data == nullptr) return nullptr;
  PinnedThreadData pin(data);  // a sub-language hook's step-out target is its own code
  if (!__tracer_step_out(data)) return nullptr;
  Py_RETURN_NONE;
}

PyObject* _tracer_bootstrap_new_thread(PyObject* self, PyObject* args) {
  if (!initialised("bootstrap_new_thread")) return nullptr;
  PyThreadState* ts = compat::current_tstate();
  if (gSelf.event_source == kEventsFromMonitoring) {
    // sys.monitoring delivered this thread's events from its first frame on (this very
    // call's too): its record and policy answer are this thread's own, and the trace function
    // that the thread start hook set only served to bring us here.
    PyEval_SetTrace(nullptr, nullptr);
    if (PyErr_Occurred() != nullptr) return nullptr;
    Py_RETURN_NONE;
  }
  // The interpreter reuses thread-state memory: a record under this pointer belongs to a
  // thread that has ended.
  __tracer_forget_thread(ts);
  // So is the thread identity: an answer of the thread policy belongs to the earlier thread.
  __clear_should_debug_thread_cache(get_thread_ident());
  install_tracer_into_frames(ts);
  set_global_trace_function(1);
  return _tracer_trace_dispatch(self, args);
}

PyObject* _tracer_thread_exiting(PyObject*, PyObject*) {
  PyThreadState* ts = compat::current_tstate();
  ThreadData* data = find_thread_data(&gSelf.thread_table, ts);
  // The thread's last returns must not bring its record back: it stops being traced here.
  if (data != nullptr && data->global_trace_set && gSelf.event_source == kEventsFromTrace) {
    PyEval_SetTrace(nullptr, nullptr);
    if (PyErr_Occurred() != nullptr) return nullptr;
  }
  __tracer_forget_thread(ts);
  // Thread identities are reused too: a later thread must be asked about afresh.
  __clear_should_debug_thread_cache(get_thread_ident());
  Py_RETURN_NONE;
}

PyObject* _tracer_is_internal_frame(PyObject*, PyObject* args) {
  PyObject* frame = nullptr;
  if (!PyArg_ParseTuple(args, "O!:is_internal_frame", &PyFrame_Type, &frame)) return nullptr;
  return PyLong_FromLong(is_internal_frame(frame));
}

PyObject* raise_exception(PyObject*, PyObject* args) {
  long thread_id = 0;  // kept for compatibility: the calling thread is always the target
  PyObject* exc = nullptr;
  if (!PyArg_ParseTuple(args, "lO:raise_exception", &thread_id, &exc)) return nullptr;
  ThreadData* data = calling_thread_record();
  if (data == nullptr) return nullptr;
  if (!__tracer_set_pending_exception(data, exc)) return nullptr;
  monitoring_lines_needed();  // raised at the thread's next event, which must come
  Py_RETURN_NONE;
}
