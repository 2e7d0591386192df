"""Repeats a session in which the program runs freely long enough for the idle callback to
run (start_trace, a loop of about a second, stop_trace, reset) with an idle period set, and
prints the interpreter's total reference count after each cycle, one number per line, then
the number of idle calls. Under sys.monitoring the loop sends no events once its places are
quiet: the idle calls then come from the core's ticker, which takes the interpreter lock
from a thread of its own. Run by test_refcounts.py on the debug interpreters."""

import array
import gc
import sys
import threading
import time

import tvantrel30pydebugstackless as core

# See refcount_cycle.py: the type attribute cache is emptied before each reading.
_clear_interpreter_caches = getattr(sys, "_clear_internal_caches", None) or sys._clear_type_cache

idle_calls = array.array("q", [0])


def idle():
    idle_calls[0] += 1


def line_cb(frame, changed):
    core.continue_run()


def return_cb(frame, value, changed):
    core.continue_run()


def exception_cb(frame, exc, changed):
    core.continue_run()


def hooks(flag):
    threading.settrace(core.bootstrap_new_thread if flag else None)


def spin(seconds):
    end = time.monotonic() + seconds
    n = 0
    while time.monotonic() < end:
        n += 1
    return n


def cycle():
    core.continue_run()
    core.start_trace()
    spin(1.1)
    core.stop_trace()
    core.reset()


def main(cycles):
    core.init(0.1, 0, hooks, idle, line_cb, return_cb, exception_cb, lambda: None, None,
              __import__, None, {})
    spin(0.1)
    gc.collect()
    totals = array.array("q", [0] * cycles)  # machine integers: see refcount_cycle.py
    for i in range(cycles):
        cycle()
        _clear_interpreter_caches()
        gc.collect()
        totals[i] = sys.gettotalrefcount()
    for value in totals:
        print(value)
    print("idle", idle_calls[0])


if __name__ == "__main__":
    main(int(sys.argv[1]))
