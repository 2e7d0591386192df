// dispatch.h: the trace function. The interpreter calls c_dispatch on every call, line,
// return and exception event of a traced thread; trace_dispatch is the same function as a
// Python callable, for frames' f_trace and for code that saves and restores sys.settrace.
#pragma once

#include <Python.h>

#include "threads/threadops.h"

int c_dispatch(PyObject* obj, PyFrameObject* frame, int what, PyObject* arg);
// The same for an event that sys.monitoring delivered, already mapped to a trace event code;
// for a return event `arg` is the value returned, or null when an exception left the frame.
int dispatch_monitoring_event(PyFrameObject* frame, int what, PyObject* arg);
PyObject* _tracer_trace_dispatch(PyObject* self, PyObject* args);

// Per-event handlers, for the calling thread's record: 0 to go on, -1 to stop tracing the
// thread, -2 (call only) to let an exception propagate into the user's code. A handler that
// runs Python code may lose the record (a callback can reset the core) and looks it up again.
int dispatch_call(ThreadData* data, PyObject* frame);
int dispatch_line(ThreadData* data, PyObject* frame);
int dispatch_return(ThreadData* data, PyObject* frame, PyObject* retval);

// 1 when the calling thread (`ts`, record `data`) may be traced, installing what it lacks.
int __ensure_tracer_status(PyThreadState* ts, ThreadData* data);

// The event a thread is dispatching, kept on the dispatcher's stack and reachable from the
// thread's record: whether the thread holds the selvane mutex for it yet.
struct DispatchEvent {
  PyObject* frame;       // borrowed for the duration of the event
  bool entered;          // the thread holds the mutex and its current frame is set
  DispatchEvent* outer;  // an event this one interrupted, or null
  int tracing_at_entry;  // the thread's tracing counter when it entered the debugger
};

// The nested calls the core's own work may make beyond the program's recursion limit (see
// compat::RecursionRoom): an event is handled with at least this many left.
constexpr int kCoreRecursionRoom = 50;

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
