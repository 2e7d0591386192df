"""Repeats a round of breakpoint and import work under the tracer and prints the interpreter's
total reference count after each round, one number per line. Run by test_refcounts.py on the
debug interpreter; tracing runs in this process, so it is kept out of pytest's.

A round: set thousands of breakpoints (with and without conditions, broken conditions,
temporary ones, ignore counts) on this file's lines and on files that do not exist; run code
that hits them; import, import again and reload a few modules written to a temporary folder,
register them and fetch the new-imports list; change and clear the breakpoints; stop tracing
and reset.

The code-object table keeps each registered code object until a sweep finds it held by the
table alone, and sweeps run every 5000 table calls. A sweep gives back one level of nesting
at a time (a function's code is still held by its module code's constants until the module
code is gone), so before measuring, each round makes enough look-ups for four sweeps, which
gives back every code object that a reload replaced (module, class body, method).

Usage: python refcount_breakpoints.py ROUNDS
"""

import array
import gc
import importlib
import os
import sys
import tempfile
import threading

import tvantrel30pydebugstackless as core

# The interpreter's type attribute cache keeps the last name looked up in each slot: a lookup
# by a C string leaves a fresh name object there until another lookup evicts it. Emptied
# before each reading, so that the totals show only what the core itself still holds.
_clear_interpreter_caches = getattr(sys, "_clear_internal_caches", None) or sys._clear_type_cache

HERE = os.path.abspath(__file__)
MODULE_NAMES = [f"rcmod{i}" for i in range(5)]
stops = []
imported = []


def line_cb(frame, changed):
    stops.append((frame.f_lineno, len(changed[0]), len(changed[1])))


def return_cb(frame, value, changed):
    stops.append(("return", len(changed[1])))


def exception_cb(frame, exc, changed):
    stops.append(("exception", len(changed[1])))


def import_cb(module):
    imported.append(module.__name__)


def hooks(flag):
    threading.settrace(core.bootstrap_new_thread if flag else None)


def hot(n):
    total = 0
    for i in range(n):
        total += i  # hot 1
        total -= 1  # hot 2
        total *= 1  # hot 3
    return total  # hot 4


def lines_of(tag):
    with open(HERE) as f:
        return [n for n, text in enumerate(f, 1) if text.rstrip().endswith("# " + tag)]


HOT = [lines_of(f"hot {k}")[0] for k in range(1, 5)]
CONDITIONS = [None, "i % 2 == 0", "no_such_name", "", "1 +", "i > 100", "total >= 0",
              "i in (1, 2, 'x') and not total < 0", "len(str(i)) < 0", "(w := i) < 0",
              "'i' in locals() and i == 1", "i.real == 1", "x" * 100_000]


def set_breakpoints():
    ids = []
    for k in range(3000):
        cond = CONDITIONS[k % len(CONDITIONS)]
        temporary = 1 if k % 5 == 0 else 0
        ignore = k % 3
        if k < 400:
            ids.append(core.set_break(HERE, HOT[k % 4], 1, temporary, cond, ignore))
        elif k < 1400:
            ids.append(core.set_break(f"/no/such/folder/file{k % 50}.py", k % 300, 1, temporary,
                                      cond, ignore))
        else:
            ids.append(core.set_break(HERE, k % 400, k % 2, temporary, cond, ignore))
    return ids


def change_and_clear():
    for k in range(0, 300, 3):
        core.enable_breaks(f"/no/such/folder/file{k % 50}.py", k, 0)
        core.ignore_breaks(HERE, k, 2)
        core.set_breaks_cond(HERE, k, "total > 1" if k % 2 else None)
        core.get_breaks(HERE, k)
    core.get_file_breaks(HERE)
    for k in range(0, 400, 2):
        core.clear_breaks(HERE, k)
    core.get_changed_bps_lists()
    core.clear_all_breaks()
    core.get_changed_bps_lists()


def imports(folder):
    for name in MODULE_NAMES:
        if name in sys.modules:
            importlib.reload(sys.modules[name])
        else:
            __import__(name)
        __import__(name)
        core.register_module(sys.modules[name])
    importlib.import_module(MODULE_NAMES[0])
    core.get_new_imports()


def settle():
    frame = sys._getframe()
    for _ in range(4 * 5000 + 1):
        core.get_frame_file(frame)


def round_(folder):
    core.continue_run()
    core.start_trace()
    set_breakpoints()
    hot(30)
    imports(folder)
    worker = threading.Thread(target=hot, args=(10,))
    worker.start()
    worker.join()
    change_and_clear()
    core.stop_trace()
    core.reset()
    assert len(stops) > 50 and len(imported) >= 2 * len(MODULE_NAMES), (len(stops), imported)
    stops.clear()
    imported.clear()
    gc.collect()  # replaced classes are cycles: they go first, then the sweep can see them
    settle()


def main(rounds):
    folder = tempfile.mkdtemp()
    for name in MODULE_NAMES:
        with open(os.path.join(folder, name + ".py"), "w") as f:
            f.write("import os\nVALUE = 1\n\ndef f(x):\n    return x + VALUE\n\n"
                    "class C:\n    def m(self):\n        return f(2)\n")
    sys.path.insert(0, folder)
    core.init(0.0, 0, hooks, lambda: None, line_cb, return_cb, exception_cb, lambda: None,
              import_cb, __import__, None, {})
    # An untraced run first: the interpreter and the import system fill their own caches.
    hot(30)
    imports(folder)
    imports(folder)
    gc.collect()
    settle()
    gc.collect()
    # Machine integers, made before measuring: storing int objects in place of the immortal
    # small int 0 (3.12 on) would itself add a counted reference per round.
    totals = array.array("q", [0] * rounds)
    for i in range(rounds):
        round_(folder)
        _clear_interpreter_caches()
        gc.collect()
        totals[i] = sys.gettotalrefcount()
    for total in totals:
        print(total)


if __name__ == "__main__":
    main(int(sys.argv[1]))
