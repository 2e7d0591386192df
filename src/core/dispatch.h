// dispatch.h: the trace function. The interpreter calls c_dispatch on every call, line,
// return and exception event of a traced thread; trace_dispatch is the same function as a
// Python callable, for frames' f_trace and for code that saves and restores sys.settrace.
#pragma once

#include <Python.h>

#include "threads/threadops.h"

int c_dispatch(PyObject* obj, PyFrameObject* frame, int what, PyObject* arg);
PyObject* _tracer_trace_dispatch(PyObject* self, PyObject* args);

// Per-event handlers: 0 to go on, -1 to stop tracing the thread, -2 (call only) to let an
// exception propagate into the user's code.
int dispatch_call(PyObject* frame);
int dispatch_line(PyObject* frame);
int dispatch_return(PyObject* frame, PyObject* retval);

int __ensure_tracer_status();

// The event a thread is dispatching, kept on the dispatcher's stack and reachable from the
// thread's record: whether the thread holds the selvane mutex for it yet.
struct DispatchEvent {
  PyObject* frame;       // borrowed for the duration of the event
  bool entered;          // the thread holds the mutex and its current frame is set
  DispatchEvent* outer;  // an event this one interrupted, or null
};

// The handlers for a thread whose record the dispatcher already holds.
int dispatch_call_for(ThreadData* data, PyObject* frame);
int dispatch_line_for(ThreadData* data, PyObject* frame);
int dispatch_return_for(ThreadData* data, PyObject* frame, PyObject* retval);
int ensure_tracer_status_for(PyThreadState* ts, ThreadData* data);
int do_callback(PyObject* cb, PyObject* frame, PyObject* arg);
int do_idle();

// Takes the selvane mutex for the event in progress if this thread does not hold it yet.
// The dispatcher takes it lazily: while nobody is inside the debugger and an event runs no
// Python code and cannot release the interpreter lock, the interpreter lock alone already
// keeps every other thread out. Everything that may run Python code (callbacks, conditions,
// hooks, debug output, releases that can run finalizers) calls this first.
void enter_debugger();

// Calls quit_cb() when autoquit is on; its result and error are dropped.
void call_quit_cb_if_autoquit();

// Called in a forked child (by the C library, inside fork): only sets a flag.
void note_fork_in_child();
