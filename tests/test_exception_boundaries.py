"""Exceptions that only C code or a `with` exit can end, in exception mode 2 (stop when
nothing will catch it): everyday code that raises and then handles must run without a stop,
and the same shapes where the exception really escapes must stop once, in the first frame
from which nothing can catch it any more, before the stack unwinds past it. Every traced
program runs in a subprocess under the scripted server side, and its output and exit status
are compared with an untraced run."""

import pytest

from conftest import run_plain, run_traced

FREE = dict(first="continue_run", default="continue_run", when_elsewhere="continue_run",
            all_files=True)


def exception_stops(run):
    return [s[:5] for s in run.stops if s[0] == "exception"]


def traced_like_plain(tmp_path, program, **config):
    run = run_traced(tmp_path, program, exception_mode=2, **dict(FREE, **config))
    plain = run_plain(tmp_path, program)
    assert (run.returncode, run.stdout) == (plain.returncode, plain.stdout), run.stderr
    if plain.returncode != 0:
        assert run.stderr.splitlines()[-1] == plain.stderr.splitlines()[-1]
    return run


# Each program handles every exception it raises: any stop is false.
HANDLED = {
    "regex_group": """
        import re
        print(re.compile(r"x(?:y)z").pattern)
    """,
    "hasattr_property": """
        class Obj:
            @property
            def value(self):
                raise AttributeError("no value")
        print(hasattr(Obj(), "value"))
    """,
    "getattr_default": """
        class Obj:
            def __getattr__(self, name):
                raise AttributeError(name)
        print(getattr(Obj(), "thing", "default"))
    """,
    "deepcopy_getattr": """
        import copy
        class Obj:
            def __getattr__(self, name):
                raise AttributeError(name)
        print(type(copy.deepcopy(Obj())).__name__)
    """,
    "old_sequence_protocol": """
        class OldSeq:
            def __getitem__(self, index):
                if index < 3:
                    return index
                raise IndexError(index)
        print(list(OldSeq()))
    """,
    "suppress": """
        import contextlib
        with contextlib.suppress(ValueError):
            raise ValueError("suppressed")
        print("after")
    """,
    "suppress_in_function": """
        import contextlib
        def f():
            with contextlib.suppress(KeyError, ValueError):
                {}["missing"]
            return "after"
        print(f())
    """,
    "contextmanager_catches": """
        import contextlib
        @contextlib.contextmanager
        def tolerant():
            try:
                yield
            except ValueError as exc:
                print("tolerated", exc)
        with tolerant():
            raise ValueError("inside")
        print("after")
    """,
    "other_exit_suppresses": """
        class Swallow:
            def __enter__(self):
                return self
            def __exit__(self, *info):
                return True
        def f():
            with Swallow():
                raise KeyError("swallowed")
            return "after"
        print(f())
    """,
    "sorted_key_via_c": """
        def key(item):
            try:
                return int(item)
            except ValueError:
                return 0
        print(sorted(["3", "x", "1"], key=key))
    """,
    "platform": """
        import platform
        print(bool(platform.platform()))
    """,
}


@pytest.mark.parametrize("name", sorted(HANDLED))
def test_handled_exceptions_do_not_stop(tmp_path, name):
    run = traced_like_plain(tmp_path, HANDLED[name])
    assert run.returncode == 0
    assert exception_stops(run) == []


# The same shapes where the exception escapes: one stop, in the first frame nothing can catch
# it from (file, line, function, type).
ESCAPING = {
    "hasattr_property": ("""
        class Obj:
            @property
            def value(self):
                raise ValueError("not an AttributeError")
        print(hasattr(Obj(), "value"))
    """, ("prog.py", 5, "<module>", "ValueError")),
    "getattr_no_default": ("""
        class Obj:
            def __getattr__(self, name):
                raise AttributeError(name)
        print(getattr(Obj(), "thing"))
    """, ("prog.py", 4, "<module>", "AttributeError")),
    "old_sequence_other_error": ("""
        class OldSeq:
            def __getitem__(self, index):
                raise KeyError(index)
        def use():
            return list(OldSeq())
        print(use())
    """, ("prog.py", 5, "use", "KeyError")),
    "suppress_other_type": ("""
        import contextlib
        with contextlib.suppress(ValueError):
            raise TypeError("not suppressed")
    """, ("prog.py", 3, "<module>", "TypeError")),
    "contextmanager_other_type": ("""
        import contextlib
        @contextlib.contextmanager
        def tolerant():
            try:
                yield
            except ValueError:
                pass
        def f():
            with tolerant():
                raise TypeError("escapes")
        f()
    """, ("prog.py", 10, "f", "TypeError")),
    "other_exit_lets_go": ("""
        class Keep:
            def __enter__(self):
                return self
            def __exit__(self, *info):
                return False
        def f():
            with Keep():
                raise KeyError("escapes")
        f()
    """, ("prog.py", 8, "f", "KeyError")),
    "through_several_frames": ("""
        def inner():
            raise KeyError("deep")
        def middle():
            inner()
        def outer():
            middle()
        outer()
    """, ("prog.py", 2, "inner", "KeyError")),
}


@pytest.mark.parametrize("name", sorted(ESCAPING))
def test_escaping_exceptions_stop_once_where_nothing_catches(tmp_path, name):
    program, expected = ESCAPING[name]
    run = traced_like_plain(tmp_path, program)
    assert run.returncode == 1
    assert exception_stops(run) == [("exception",) + expected]
