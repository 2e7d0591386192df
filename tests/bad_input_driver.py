"""Calls every method of the core with a spread of wrong arguments, in this process, and
prints one line per call that did not raise: "ok <method> <argument kinds>". A crash of the
process is what test_bad_input.py looks for; after the storm it checks the core still works
and prints "core works".

Usage: python bad_input_driver.py [with_tracing]
"""

import sys
import threading

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
