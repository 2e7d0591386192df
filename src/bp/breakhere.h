// breakhere.h: the test whether a line event hits a breakpoint.
#pragma once

#include <Python.h>

#include "bp/bpops.h"
#include "threads/threadops.h"

// 1 when an enabled breakpoint at the frame's line is hit; updates hit counts when `update`.
int __tracer_break_here(BpOpsData* data, int event, ThreadData* thread, PyObject* frame,
                        int update);
