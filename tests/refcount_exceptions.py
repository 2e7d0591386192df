"""Repeats rounds of raising and catching under the core in every exception mode and prints
the interpreter's total reference count after each round, one number per line. Run by
test_refcounts.py on a debug interpreter; tracing runs in this process.

A round, in each of the modes 0, 1, 2, 4 and 5, with always- and never-stop lists, an ignored
location, ignored handlers and a catch-info list in force: exceptions raised and caught in the
same frame, one and two frames out, in generators and for loops, exceptions leaving frames
(the per-frame records), and a RecursionError."""

import builtins
import array
import gc
import sys
import threading

import tvantrel30pydebugstackless as core

# The interpreter's type attribute cache keeps the last name looked up in each slot: a lookup
# by a C string leaves a fresh name object there until another lookup evicts it. Emptied
# before each reading, so that the totals show only what the core itself still holds.
_clear_interpreter_caches = getattr(sys, "_clear_internal_caches", None) or sys._clear_type_cache

ORIGINAL_IMPORT = builtins.__import__


class Info:
    def __init__(self, co_name, prints, parent):
        self.co_name, self.mod_name, self.containing_class = co_name, "*", "*"
        self.prints, self.parent = prints, parent


def answer(*args):
    core.continue_run()


def raise_here(n):
    try:
        raise KeyError(n)
    except KeyError:
        return n


def leaf(n):
    raise ValueError(n)


def middle(n):
    return leaf(n)


def caught_out(n):
    try:
        middle(n)
    except ValueError:
        return n


def gen(n):
    for i in iter(range(n).__iter__().__next__, n - 1):  # ends with StopIteration in a loop
        yield i


def printer(n):
    try:
        middle(n)
    except ValueError:
        return -n


def deep(n):
    return deep(n + 1)


def scenario():
    total = 0
    for i in range(200):
        total += raise_here(i) + caught_out(i) + printer(i) + sum(gen(3))
    try:
        deep(0)
    except RecursionError:
        total += 1
    return total


def one_round():
    for mode in (0, 1, 2, 4, 5):
        core.set_exception_mode(mode)
        core.set_always_stop_excepts((OSError,))
        core.set_never_stop_excepts((KeyError,))
        core.set_ignored_exception_handlers({caught_out.__code__: 1})
        core.set_exc_catch_info_list([Info("printer", True, False), Info("middle", True, True)])
        core.ignore_exception_loc(__file__, leaf.__code__.co_firstlineno + 1, 1)
        core.continue_run()
        core.start_trace()
        scenario()
        core.stop_trace()
        core.reset()


def main(rounds):
    core.init(0.0, 0, lambda flag: threading.settrace(core.bootstrap_new_thread if flag else None),
              lambda: None, answer, answer, answer, lambda: None, None, ORIGINAL_IMPORT, None, {})
    scenario()  # untraced first: the interpreter fills its own caches
    gc.collect()
    # Machine integers, made before measuring: storing int objects in place of the immortal
    # small int 0 (3.12 on) would itself add a counted reference per round.
    totals = array.array("q", [0] * rounds)
    for i in range(rounds):
        one_round()
        _clear_interpreter_caches()
        gc.collect()
        totals[i] = sys.gettotalrefcount()
    for total in totals:
        print(total)


if __name__ == "__main__":
    main(int(sys.argv[1]))
