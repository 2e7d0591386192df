// exception_dispatch.cpp: what the tracer does with exception events and with frames that
// an exception leaves, and the delivery of exceptions injected with raise_exception.
//
// The decision by exception mode uses only the always-stop mode and the stepping state for
// now; the stop lists, the handler prediction from the byte code and the location filters
// join it with the exception analysis.
#include "core/exception_dispatch.h"

#include "core/dispatch.h"
#include "core/stepping.h"
#include "core/thread_policy.h"
#include "core/tracercore.h"
#include "support/dprintf.h"
#include "support/pycompat.h"

int dispatch_exception(PyObject* frame, PyObject* exc_arg) {
  do_dprintf(kDbgFlow, "---EXCEPTION---\n");
  if (!gSelf.trace_started) return -1;
  if (!compat::is_plain_frame(frame) || !PyTuple_CheckExact(exc_arg) ||
      PyTuple_GET_SIZE(exc_arg) == 0) {
    do_dprintf(kDbgFlow, "  exit 0\n");
    return 0;
  }
  PyObject* exc_type = PyTuple_GET_ITEM(exc_arg, 0);
  if (__tracer_stop_here(frame, -1) || stop_at_exception_no_filters(frame, exc_type)) {
    do_dprintf(kDbgFlow, "  dispatched=TRUE\n");
    if (do_exception_callback_if_not_filtered(frame, exc_arg) != 0) {
      do_dprintf(kDbgFlow, "  failure\n");
      return -1;
    }
  }
  return 0;
}

int stop_at_exception_no_filters(PyObject*, PyObject* exc_type) {
  do_dprintf(kDbgExceptions, "stop_at_exception_no_filters\n");
  if (gSelf.exception_mode == kExcAlwaysStop) return 1;
  if (gSelf.never_stop_excepts &&
      PyErr_GivenExceptionMatches(exc_type, gSelf.never_stop_excepts.get())) {
    do_dprintf(kDbgFlow, "  never stop\n");
    return 0;
  }
  return 0;
}

int do_exception_callback_if_not_filtered(PyObject* frame, PyObject* exc_arg) {
  return do_callback(gSelf.exception_cb.get(), frame, exc_arg);
}

int dispatch_exception_return(PyObject* frame, PyObject*) {
  if (!compat::is_plain_frame(frame)) return 0;
  ThreadData* data = current_thread_data_or_insert(&gSelf.thread_table);
  if (data == nullptr) {
    PyErr_Clear();
    return 0;
  }
  if (data->bot_frame.is(frame)) {
    unsigned long identity = get_thread_ident();
    enter_debugger();
    data->bot_frame = Ref::none();
    call_quit_cb_if_autoquit();
    __clear_should_debug_thread_cache(identity);
  }
  return 0;
}

int __tracer_set_pending_exception(ThreadData* data, PyObject* exc) {
  bool raisable = exc == Py_None || PyExceptionInstance_Check(exc) || PyExceptionClass_Check(exc);
  if (!raisable) {
    PyErr_SetString(PyExc_TypeError, "exceptions must derive from BaseException");
    return 0;
  }
  if (data->pending_exception) {
    data->pending_exception.reset();
    --gSelf.pending_exception_count;
  }
  if (exc != Py_None) {
    data->pending_exception = Ref::borrow(exc);
    ++gSelf.pending_exception_count;
  }
  return 1;
}

int __tracer_raise_pending_exception(ThreadData* data) {
  if (data == nullptr || !data->pending_exception) return 0;
  Ref exc = std::move(data->pending_exception);
  --gSelf.pending_exception_count;
  if (PyExceptionClass_Check(exc.get())) {
    PyErr_SetNone(exc.get());
  } else {
    PyErr_SetObject(reinterpret_cast<PyObject*>(Py_TYPE(exc.get())), exc.get());
  }
  return 1;
}
