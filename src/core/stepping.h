// stepping.h: the stop decision of the stepping commands and the commands themselves.
//
// The stepping state lives in the calling thread's record: stop_frame (null runs freely,
// None stops at the next event, a frame stops in that frame or once it is gone from the
// stack), step_out_frame (its return always stops) and an optional line range of the stop
// frame that is stepped over.
#pragma once

#include <Python.h>

#include "threads/threadops.h"

// Event codes for the decision: 1 line, 2 return, -1 exception.
int __tracer_stop_here(PyObject* frame, int event);
// The same for a thread whose record the caller already holds.
int stop_here_for(ThreadData* data, PyObject* frame, int event);

void __tracer_step_into(ThreadData* data);
void __tracer_step_over(ThreadData* data);
void __tracer_step_over_line(ThreadData* data);
void __tracer_step_over_line_range(ThreadData* data, int first, int last);
int __tracer_step_out(ThreadData* data);  // 0 with the hook's error set on failure
void __tracer_continue_run(ThreadData* data);
void __tracer_stop(ThreadData* data);
