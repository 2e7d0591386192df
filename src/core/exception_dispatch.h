// exception_dispatch.h: exception events, frames left by an exception, and exceptions
// injected into a thread with raise_exception.
#pragma once

#include <Python.h>

#include "threads/threadops.h"

int dispatch_exception(PyObject* frame, PyObject* exc_arg);
// The decision by mode, stop lists and handlers, for an exception of `exc_type` (event
// argument `exc_arg`) in `frame`: 1 to stop.
int stop_at_exception_no_filters(PyObject* frame, PyObject* exc_type, PyObject* exc_arg);
int do_exception_callback_if_not_filtered(PyObject* frame, PyObject* exc_arg);
int dispatch_exception_return(PyObject* frame, PyObject* recorded_exc_arg);

// Stores (or, for None, clears) the exception to raise in the calling thread at its next
// trace event. 0 with an error set when the object cannot be raised.
int __tracer_set_pending_exception(ThreadData* data, PyObject* exc);
// Sets the thread's pending exception as the current error and forgets it; 1 if it did.
int __tracer_raise_pending_exception(ThreadData* data);
