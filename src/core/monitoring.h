// monitoring.h: the second event source, sys.monitoring (CPython 3.12 and later).
//
// The trace function makes the interpreter call us on every event of every traced frame.
// With sys.monitoring the core registers C callbacks as the debugger tool and receives the
// same events, mapped to the trace function's call, line, return and exception events so that
// every decision downstream (stepping, breakpoints, exceptions, threads, sub-languages) is
// the same whichever source delivered the event:
//
//   call       <- PY_START, PY_RESUME, PY_THROW
//   return     <- PY_RETURN and PY_YIELD with their value; PY_UNWIND, the frame left by an
//                 exception (no value)
//   exception  <- RAISE (delivered in every frame the exception passes through, as the trace
//                 function's exception event is) and STOP_ITERATION
//   line       <- LINE, and a JUMP backwards within one line (the trace function reports the
//                 line again for each turn of a loop written on one line)
//
// RERAISE, EXCEPTION_HANDLED and C_RAISE have no counterpart and are not asked for. PY_START
// stays on wherever lines are wanted: from 3.13 on, a code object whose body is on its
// header line reports no LINE for that line unless PY_START is enabled for it.
//
// The event bit values moved in 3.14: they are read from sys.monitoring.events at start.
#pragma once

#include <Python.h>

// SELVANE_EVENT_SOURCE as init reads it: "settrace" or "monitoring"; unset or empty, the
// default: sys.monitoring where the interpreter has it (3.12+), else the trace function. 0
// with the choice stored in *source, or -1 with ValueError (an unknown value) or
// RuntimeError (monitoring asked for where the interpreter has no sys.monitoring).
int read_event_source_setting(int* source);

// Takes the debugger tool id and registers the callbacks with their events. 0, or -1 with
// RuntimeError naming the tool that holds the id (nothing changed then).
int monitoring_start();
// Switches every event of the tool off, unregisters the callbacks and frees the id. Errors
// are logged and dropped: stopping must always succeed.
void monitoring_stop();

// Places that cannot stop go quiet (answer DISABLE) where no thread's stepping can stop in
// their code (a thread running freely cannot; one stepping over or out of a frame stops only
// in that frame's code; one stepping into, told to stop, stepping over a line range or with
// an injected exception to raise can stop anywhere) and no sub-language is registered: a
// LINE or same-line backward JUMP of a line without a breakpoint in any file; a
// function's PY_START once its thread has a bottom frame (unless a breakpoint is on its first
// line, which 3.13+ would not report then); a function's PY_RETURN/PY_YIELD unless it is some
// thread's bottom frame or holds an exception record. A JUMP that never starts a line again
// is always quiet. Exception events (RAISE, PY_UNWIND, PY_THROW) never are.
// Whatever can make a stop possible again calls this before the program runs on: a stepping
// command, stop, a new breakpoint, an idle period, a sub-language hook, an injected
// exception, start_trace. It turns every quiet place on again (for every tool: the
// interpreter knows no narrower way); nothing happens while no place is quiet.
void monitoring_lines_needed();
