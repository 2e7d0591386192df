// install.h: switching tracing on and off: the calling thread's C trace function, the
// f_trace slot of every frame of a thread, all threads of the interpreter, threads started
// later, and the start_trace / stop_trace commands.
#pragma once

#include <Python.h>

int set_global_trace_function(int on);
void install_tracer_into_frames(PyThreadState* tstate);
void remove_tracer_from_frames(PyThreadState* tstate);
void install_tracer(PyInterpreterState* interp);
void remove_tracer(PyInterpreterState* interp);
void install_start_thread_hooks(int flag);
int __tracer_start_trace();
void __tracer_stop_trace();
int __is_threading_bootstrap(PyObject* frame);
int is_internal_frame(PyObject* frame);
