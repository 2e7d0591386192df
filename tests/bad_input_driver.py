"""Calls every method of the core with a spread of wrong arguments, in this process, and
prints one line per call that did not raise: "ok <method> <argument kinds>". A crash of the
process is what test_bad_input.py looks for; after the storm it checks the core still works
and prints "core works".

Usage: python bad_input_driver.py [with_tracing]
"""

import os
import sys
import threading
import types

import tvantrel30pydebugstackless as core
from core_args import init_args, noop


def kinds():
    frame = sys._getframe()
    return [
        (), (None,), (0,), (-1,), (1,), (2 ** 70,), (-(2 ** 70),), ("x",), (b"x",), (1.5,),
        (float("nan"),), (object(),), ([],), ({},), ((),), ((ValueError,),), (frame,),
        (frame, "line", None), (frame, "call", None), (frame, "c_call", None), (frame, "", None),
        (frame, 1, None), (frame, None, None), (None, None), (1, 2), ("x", 1), (1, "x"),
        (1, ValueError("x")), (1, ValueError), (1, 5), (frame, 0), (frame, -1),
        (1, 2, 3), (ValueError,), (noop,), (sys,), ("\udcff",), ("\x00",),
    ]


LONG = "/" + "d" * 39995 + "/x.py"  # 40001 characters, beyond the core's 32000-byte buffers


def specific():
    """Arguments aimed at the formats of the breakpoint and import methods."""
    frame = sys._getframe()
    weird_module = types.ModuleType("weird")
    weird_module.__file__ = b"/bytes/name.py"
    long_module = types.ModuleType("long")
    long_module.__file__ = LONG
    long_pyc = types.ModuleType("longpyc")
    long_pyc.__file__ = LONG + "c"
    int_module = types.ModuleType("intfile")
    int_module.__file__ = 5
    surrogate_module = types.ModuleType("surrogate")
    surrogate_module.__file__ = "/x/\udcff.py"
    cond_kinds = [None, "", "1 +", "x", "\udcff", 5, b"x", object(), "\x00", LONG]
    files = ["a.py", LONG, "\udcff", "", "\x00", b"a.py", 1, None, frame]
    lines = [1, 0, -1, 2 ** 31 - 1, -2 ** 31, 2 ** 31, 2 ** 70, 1.5, "1", None]
    calls = []
    for f in files:
        for ln in lines:
            calls.append(("set_break", (f, ln, 1, 0, None, 0)))
            calls.append(("clear_breaks", (f, ln)))
            calls.append(("enable_breaks", (f, ln, 2 ** 70)))
            calls.append(("ignore_breaks", (f, ln, -5)))
            calls.append(("get_breaks", (f, ln)))
        calls.append(("get_file_breaks", (f,)))
        for cond in cond_kinds:
            calls.append(("set_break", (f, 3, 1, 1, cond, 2)))
            calls.append(("set_breaks_cond", (f, 3, cond)))
    for flags in [(2 ** 70, 0), (0, 2 ** 70), (-1, -1), (None, 0), ("1", 0), (1.0, 0)]:
        calls.append(("set_break", ("a.py", 4) + flags + (None, 0)))
    for count in [2 ** 31, -2 ** 31, 2 ** 70, None, "2"]:
        calls.append(("set_break", ("a.py", 5, 1, 0, None, count)))
        calls.append(("ignore_breaks", ("a.py", 5, count)))
    for module in [weird_module, long_module, long_pyc, int_module, surrogate_module, sys, os,
                   types.ModuleType("nofile"), "os", None, 5, frame, {}]:
        calls.append(("register_module", (module,)))
        calls.append(("register_module", (module, module)))
    for cb in [None, noop, 5, "x", raising_callback]:
        calls.append(("set_import_cb", (cb,)))
    calls.append(("set_import_cb", ()))
    calls.append(("set_import_cb", (noop, noop)))
    calls.append(("set_import_cb", (None,)))
    for args, kwargs in [((), {}), (("",), {}), (("os",), {"level": -1}), (("\x00",), {}),
                         (("os", None, None, None, 0), {}), ((5,), {}), (("os",), {"x": 1}),
                         ((), {"name": "os"}), (("os",), {"fromlist": 5}), ((LONG,), {}),
                         (("os",), {"globals": 5, "level": 1}), (("...",), {})]:
        calls.append(("__import__", args, kwargs))
    calls.append(("get_new_imports", (1, 2)))
    calls.append(("get_changed_bps_lists", ()))
    calls.append(("clear_all_breaks", (1,)))
    return calls


def raising_callback(*args):
    raise RuntimeError("callback fails")


def specific_storm():
    for call in specific():
        name, args = call[0], call[1]
        kwargs = call[2] if len(call) > 2 else {}
        try:
            result = getattr(core, name)(*args, **kwargs)
        except Exception:
            continue
        print("ok", name, [type(a).__name__ for a in args])
        del result
    core.set_import_cb(None)
    core.clear_all_breaks()
    core.get_changed_bps_lists()


def hit_storm():
    """With tracing on: breakpoints with broken and hostile conditions on lines this function
    passes, imports with a raising import callback, and a condition that clears every
    breakpoint while the core walks them."""
    here = os.path.abspath(__file__)
    with open(here) as f:
        target = [n for n, text in enumerate(f, 1) if text.strip() == "value = i"][0]
    for cond in [None, "", "1 +", "no_such_name", "1 / 0", "\udcff", "core.clear_all_breaks()",
                 "core.set_break(here, target, 1, 1, 'core.clear_breaks(here, target)', 0)",
                 "core.get_changed_bps_lists()", "core.set_import_cb(None)", "[] or 0"]:
        for temporary in (0, 1):
            try:
                core.set_break(here, target, 1, temporary, cond, 1)
                core.set_break(LONG, target, 1, temporary, cond, 0)
            except Exception:
                pass
    core.set_break(LONG, 1, 1, 0, None, 0)
    core.set_break(LONG[:32000], 1, 1, 0, "1 +", 0)
    exec(compile("v = 1\nv = 2\n", LONG, "exec"), {})
    exec(compile("v = 1\nv = 2\n", LONG[:32000], "exec"), {})
    exec(compile("v = 1\nv = 2\n", LONG[:32001], "exec"), {"__file__": LONG})
    core.set_import_cb(raising_callback)
    for i in range(4):
        value = i
        __import__("json")
        core.register_module(sys.modules["json"])
    for mod in ("json", "os", "importlib"):
        try:
            __import__(mod, globals(), None, ["nothing_there"], 0)
        except Exception:
            pass
    print("hit storm", len(core.get_changed_bps_lists()))
    core.set_import_cb(None)
    core.clear_all_breaks()
    core.get_changed_bps_lists()
    core.get_new_imports()


def storm():
    names = sorted(n for n in dir(core) if callable(getattr(core, n)) and not n.startswith("_"))
    names.append("__import__") if hasattr(core, "__import__") else None
    for name in names:
        method = getattr(core, name)
        for args in kinds():
            if name == "acquire_selvane_mutex":
                args = ()
            try:
                result = method(*args)
            except Exception:
                continue
            finally:
                if name == "acquire_selvane_mutex":
                    core.release_selvane_mutex()
            print("ok", name, [type(a).__name__ for a in args])
            if name in ("add_to_tstate_tracing",) and args and isinstance(args[0], int):
                core.add_to_tstate_tracing(-args[0])
            if name == "set_tstate_use_tracing":
                core.set_tstate_use_tracing(1)
            if name == "init":
                core.init(*init_args())
            del result
    core.raise_exception(0, None)


def main(with_tracing):
    core.init(*init_args())
    if with_tracing:
        core.continue_run()
        core.start_trace()
    storm()
    specific_storm()
    if with_tracing:
        hit_storm()
    worker = threading.Thread(target=storm)
    worker.start()
    worker.join()
    core.stop_trace()
    core.init(*init_args())
    core.reset()
    assert core.get_tracing() == 0
    core.step_into()
    assert core.get_threads() == [core.get_current_tstate_id()]
    core.reset()
    print("core works")


if __name__ == "__main__":
    main(len(sys.argv) > 1)
