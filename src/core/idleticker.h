// idleticker.h: the idle callback while a program runs freely under sys.monitoring.
//
// The idle callback runs on traced events (at most once a second). Through the trace function
// every line of a running program is an event; under sys.monitoring a program that runs
// freely sends none once its places have gone quiet, and the idle callback would stop with
// them. While sys.monitoring is the source in force, tracing is started and the idle period
// is above 0, a native thread (the ticker) wakes twice a second, takes the interpreter lock
// and turns the quiet places on again, with the idle counter set so that the next traced
// event reads the clock. The places go quiet again at their next event; the idle callback
// keeps its cadence (the clock still decides when it runs). The thread ends as soon as ticks
// are not wanted; it is ended before os.fork (so that the program's fork sees no thread of
// ours) and made again at the next traced event after it, and ended at exit.
#pragma once

#include <Python.h>

// Starts or stops the ticker to match the tracer's state; called with the interpreter lock
// held wherever that state changes (start_trace, stop_trace, init, set_idle_period). Never
// waits for the ticker: a ticker that is no longer wanted ends on its own.
void idle_ticker_update();

// After os.fork in the parent the ticker is made again at the first idle count, not in the
// fork's own hook: 3.13 and later count the process's threads for their warning after the
// hooks have run. Called by the idle count (interpreter lock held); cheap when nothing waits.
void idle_ticker_resume_after_fork();

// At module load: registers the ticker's end with atexit (no thread of ours may take the
// interpreter lock once the interpreter finalises) and with os.register_at_fork (before; it
// is made again after, in the parent, see above). Errors are logged and dropped.
void init_idle_ticker();
