"""Repeats a concurrent lifecycle round and prints the interpreter's total reference count
after each round, one number per line, then the number of thread records left.

A round: three threads raise and catch in a loop and step from each exception, while the
main thread resets and restarts the core in a loop and the callbacks, every so often, reset
and restart it or stop and restart it from inside a stop. Run by test_refcounts.py on the
debug interpreter; tracing runs in this process, so it is kept out of pytest's."""

import array
import gc
import sys
import threading
import time

import tvantrel30pydebugstackless as core

# The interpreter's type attribute cache keeps the last name looked up in each slot: a lookup
# by a C string leaves a fresh name object there until another lookup evicts it. Emptied
# before each reading, so that the totals show only what the core itself still holds.
_clear_interpreter_caches = getattr(sys, "_clear_internal_caches", None) or sys._clear_type_cache

stops = [0]
LIFECYCLE_IN_CALLBACK = [
    lambda: (core.reset(), core.start_trace()),
    lambda: (core.stop_trace(), core.start_trace()),
]


def answer():
    stops[0] += 1
    if stops[0] % 40 == 0:
        LIFECYCLE_IN_CALLBACK[(stops[0] // 40) % 2]()
    core.step_into()


def line_cb(frame, changed):
    answer()


def return_cb(frame, value, changed):
    answer()


def exception_cb(frame, exc, changed):
    answer()


def hooks(flag):
    threading.settrace(core.bootstrap_new_thread if flag else None)


def work(k, state, results):
    total = count = 0
    while not state["stop"] or count < 30:
        try:
            raise ValueError(count)
        except ValueError as e:
            total += e.args[0] * k
        count += 1
    results[k] = total == k * sum(range(count))


def one_round(seconds):
    state = {"stop": False}
    results = {}
    threads = [threading.Thread(target=work, args=(k, state, results)) for k in (1, 2, 3)]
    core.start_trace()
    for t in threads:
        t.start()
    deadline = time.monotonic() + seconds
    while time.monotonic() < deadline:
        core.reset()
        core.start_trace()
        time.sleep(0.002)
    state["stop"] = True
    for t in threads:
        t.join()
    core.stop_trace()
    core.reset()
    assert results == {1: True, 2: True, 3: True}, results


def main(rounds, seconds):
    core.init(0.0, 1, hooks, lambda: None, line_cb, return_cb, exception_cb, lambda: None, None,
              __import__, None, {})
    # Untraced first: threading and the exception machinery fill their caches on first use.
    state = {"stop": True}
    work(1, state, {})
    gc.collect()
    # Machine integers, made before measuring: storing int objects in place of the immortal
    # small int 0 (3.12 on) would itself add a counted reference per round.
    totals = array.array("q", [0] * rounds)
    for i in range(rounds):
        one_round(seconds)
        _clear_interpreter_caches()
        gc.collect()
        totals[i] = sys.gettotalrefcount()
    for total in totals:
        print(total)
    print("threads", len(core.get_threads()))
    print("stops", stops[0])


if __name__ == "__main__":
    main(int(sys.argv[1]), float(sys.argv[2]))
