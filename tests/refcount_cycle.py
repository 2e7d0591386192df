"""Repeats a full tracing cycle (start_trace, a stepping scenario, stop_trace, reset) and
prints the interpreter's total reference count after each cycle, one number per line, then
the number of thread records left after the last reset. Run by test_refcounts.py on the
debug interpreter; tracing runs in this process, so it is kept out of pytest's."""

import array
import gc
import sys
import threading

import tvantrel30pydebugstackless as core

# The interpreter's type attribute cache keeps the last name looked up in each slot: a lookup
# by a C string leaves a fresh name object there until another lookup evicts it. Emptied
# before each reading, so that the totals show only what the core itself still holds.
_clear_interpreter_caches = getattr(sys, "_clear_internal_caches", None) or sys._clear_type_cache

stops = []


def line_cb(frame, changed):
    stops.append(frame.f_lineno)
    core.step_into() if len(stops) % 3 else core.step_over()


def return_cb(frame, value, changed):
    core.step_out() if len(stops) % 2 else core.step_into()


def exception_cb(frame, exc, changed):
    core.step_into()


def hooks(flag):
    threading.settrace(core.bootstrap_new_thread if flag else None)


def scenario():
    def gen(n):
        for i in range(n):
            yield i

    def boom():
        raise KeyError("k")

    total = sum(gen(4))
    try:
        boom()
    except KeyError:
        total += 1
    worker = threading.Thread(target=lambda: [x * 2 for x in range(5)])
    worker.start()
    worker.join()
    return total


def cycle():
    core.step_into()
    core.start_trace()
    scenario()
    core.stop_trace()
    core.reset()


def main(cycles):
    core.init(0.0, 1, hooks, lambda: None, line_cb, return_cb, exception_cb, lambda: None, None,
              __import__, None, {})
    # An untraced run first: the interpreter and threading fill their own caches on first
    # use, which is not the core's doing.
    scenario()
    gc.collect()
    # The totals are kept as machine integers, made before measuring; printing waits until
    # the end. A list would hold each total as an int object of its own, replacing the small
    # int 0, which is immortal from 3.12 on: the total would grow by one per cycle from the
    # recording alone.
    totals = array.array("q", [0] * cycles)
    for i in range(cycles):
        cycle()
        stops.clear()
        _clear_interpreter_caches()
        gc.collect()
        totals[i] = sys.gettotalrefcount()
    for total in totals:
        print(total)
    print("threads", len(core.get_threads()))


if __name__ == "__main__":
    main(int(sys.argv[1]))
