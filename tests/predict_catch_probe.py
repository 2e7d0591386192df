"""Asks tvantrel30pydebugstackless.analysis.predict_catch about exceptions in many shapes,
without tracing, and prints one JSON object: case name -> [kind, catcher function name,
file base name, line] (or the TypeError message for bad input). Run in a subprocess by
test_predict_catch.py, so that a crash or a hang fails that test.

The cases call `probe(exc)` where the exception would be raised: the frame of that call is
the frame the exception is in. Lines are found by markers (`# <- name`) in this file.
"""

import contextlib
import json
import os
import sys
import threading

from tvantrel30pydebugstackless import analysis

RESULTS = {}
SIDE_EFFECTS = []
ANALYSING = threading.Event()  # set only while predict_catch runs


def probe(name, exc, ignored=None, frame=None):
    frame = frame or sys._getframe(1)
    ANALYSING.set()
    try:
        kind, catcher, filename, line = analysis.predict_catch(frame, exc, ignored)
    finally:
        ANALYSING.clear()
    RESULTS[name] = [kind, catcher.f_code.co_name if catcher is not None else None,
                     os.path.basename(filename) if filename else None, line]


def caught():
    try:
        probe("caught", KeyError("k"))
    except LookupError:  # <- caught
        pass


def caught_by_class():
    try:
        probe("caught_by_class", KeyError)
    except (ValueError, KeyError):  # <- caught_by_class
        pass


def not_this_clause():
    try:
        probe("uncaught", KeyError("k"))
    except ValueError:
        pass


class ViaC:
    def __getattr__(self, name):
        probe("c-code", AttributeError(name))
        raise AttributeError(name)


def through_c():
    return getattr(ViaC(), "thing", None)  # <- c-code


class Keep:
    def __enter__(self):
        return self

    def __exit__(self, *info):
        if ANALYSING.is_set():
            SIDE_EFFECTS.append("__exit__ ran")
        return False


def in_with():
    with Keep():  # <- with
        probe("with", ValueError("v"))


def in_suppress():
    with contextlib.suppress(OSError, ValueError):  # <- suppress
        probe("suppress", ValueError("v"))
    with contextlib.suppress(OSError):
        probe("suppress_other", ValueError("v"))


@contextlib.contextmanager
def tolerant():
    try:
        yield
    except ValueError:  # <- contextmanager
        pass


def in_contextmanager():
    with tolerant():
        probe("contextmanager", ValueError("v"))
        probe("contextmanager_other", TypeError("t"))


def ignored():
    try:
        probe("ignored", KeyError("k"), {ignored.__code__: 1})
    except KeyError:
        pass


def for_loop_end():
    for _ in range(1):
        probe("index_error_in_loop", IndexError("i"))


class Trap:
    """Every way the analysis could run code of the program: a property on a suppress
    subclass, a __getattr__ and an __exit__ that blocks (while the analysis runs; the
    program's own exit of the block later must not)."""

    def __enter__(self):
        return self

    def __getattr__(self, name):
        if ANALYSING.is_set():
            SIDE_EFFECTS.append("__getattr__ " + name)
        raise AttributeError(name)

    def __exit__(self, *info):
        if ANALYSING.is_set():
            SIDE_EFFECTS.append("blocking __exit__ ran")
            threading.Event().wait()


class SuppressWithProperty(contextlib.suppress):
    @property
    def _exceptions(self):
        if ANALYSING.is_set():
            SIDE_EFFECTS.append("_exceptions property ran")
            raise RuntimeError("property")
        return (ValueError,)

    @_exceptions.setter
    def _exceptions(self, value):
        pass


def traps():
    with Trap():
        with SuppressWithProperty(ValueError):
            probe("traps", ValueError("v"))


def bad_input():
    frame = sys._getframe()
    for name, args in [("not_a_frame", (1, ValueError())),
                       ("not_an_exception", (frame, 42)),
                       ("ignored_not_a_dict", (frame, ValueError(), [])),
                       ("no_arguments", ())]:
        try:
            analysis.predict_catch(*args)
        except TypeError as error:
            RESULTS[name] = ["TypeError", str(error)]
    for name, value in [("prefixes_str", "/usr"), ("prefixes_int", [1]), ("prefixes_none", None)]:
        try:
            analysis.set_user_code(value)
        except TypeError as error:
            RESULTS[name] = ["TypeError", str(error)]
    RESULTS["prefixes_kept"] = list(analysis.get_user_code())


def main():
    analysis.set_user_code(["/nowhere/lib"])
    for case in (caught, caught_by_class, not_this_clause, through_c, in_with, in_suppress,
                 in_contextmanager, ignored, for_loop_end, traps, bad_input):
        case()
    RESULTS["pending_after"] = repr(sys.exc_info())
    RESULTS["side_effects"] = SIDE_EFFECTS
    markers = {}
    with open(__file__) as source:
        for number, text in enumerate(source, 1):
            if "# <- " in text:
                markers[text.split("# <- ")[1].strip()] = number
    print(json.dumps({"results": RESULTS, "markers": markers}))


if __name__ == "__main__":
    main()
