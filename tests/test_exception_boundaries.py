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


def traced_like_plain(tmp_path, program, exception_mode=2, **config):
    run = run_traced(tmp_path, program, exception_mode=exception_mode, **dict(FREE, **config))
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


# ---- StopIteration and IndexError at FOR_ITER and SEND -------------------------------------

INDEX_ERROR_BELOW_AWAIT = """
    async def coro():
        raise IndexError("deep")

    async def main():
        for _ in range(1):
            await coro()

    try:
        main().send(None)
    except IndexError:
        print("caught at the top")
"""


def test_index_error_reaching_an_await_in_a_for_loop_is_not_handled_there(tmp_path):
    # Mode 0 with IndexError always stopping: neither coro nor main has a clause of its own,
    # so both stop; the await (SEND) inside the loop does not end an IndexError.
    run = traced_like_plain(tmp_path, INDEX_ERROR_BELOW_AWAIT, exception_mode=0,
                            prelude="core.set_always_stop_excepts((IndexError,))")
    assert exception_stops(run) == [("exception", "prog.py", 2, "coro", "IndexError"),
                                    ("exception", "prog.py", 6, "main", "IndexError")]


ESCAPING_LOOPS = {
    # Driven by Python loops only (no C code between the frames): the IndexError passes
    # the `yield from` (SEND) and the outer `for` (FOR_ITER), and nothing else catches it.
    "index_error_at_send": ("""
        def inner():
            raise IndexError("deep")
            yield
        def middle():
            for _ in range(1):
                yield from inner()
        def run():
            for _ in middle():
                pass
        run()
    """, ("prog.py", 2, "inner", "IndexError")),
    "index_error_from_a_generator_at_for_iter": ("""
        def numbers():
            yield 1
            raise IndexError("not the end of the loop")
        def total():
            return sum(n for n in [0]) + len([n for n in numbers()])
        total()
    """, ("prog.py", 3, "numbers", "IndexError")),
}


@pytest.mark.parametrize("name", sorted(ESCAPING_LOOPS))
def test_loops_end_only_on_the_stop_iteration_of_their_iterator(tmp_path, name):
    program, expected = ESCAPING_LOOPS[name]
    run = traced_like_plain(tmp_path, program)
    assert run.returncode == 1
    assert exception_stops(run) == [("exception",) + expected]


LOOPS_THAT_END = """
    class Countdown:
        def __init__(self):
            self.n = 2
        def __iter__(self):
            return self
        def __next__(self):
            self.n -= 1
            if self.n < 0:
                raise StopIteration
            return self.n
    def numbers():
        yield 1
        return 2
    def delegate():
        result = yield from numbers()
        return result
    print(list(Countdown()), [n for n in Countdown()], list(delegate()))
    for n in numbers():
        pass
"""


def test_loops_ending_on_their_own_stop_iteration_do_not_stop(tmp_path):
    run = traced_like_plain(tmp_path, LOOPS_THAT_END)
    assert run.returncode == 0
    assert exception_stops(run) == []


# ---- exceptions that the program never sees -------------------------------------------------

NEVER_SEEN = """
    class Noisy:
        def __del__(self):
            raise ValueError("in __del__")

    def closing():
        try:
            yield 1
        except GeneratorExit:
            raise

    def make_and_drop():
        n = Noisy()
        del n

    make_and_drop()
    g = closing()
    next(g)
    g.close()
    print("after")
"""


def test_exceptions_in_del_and_in_closing_generators_do_not_stop(tmp_path):
    # __del__ is called by the interpreter's C code, which reports and drops what it raises;
    # close() ends the GeneratorExit it throws in.
    run = traced_like_plain(tmp_path, NEVER_SEEN)
    assert run.returncode == 0 and run.stdout == "after\n"
    assert "in __del__" in run.stderr
    assert exception_stops(run) == []


# ---- user-unhandled (mode 3) -------------------------------------------------------------------

LIBRARY = ("import sysconfig\n"
           "from tvantrel30pydebugstackless import analysis\n"
           "paths = sysconfig.get_paths()\n"
           "analysis.set_user_code([paths['stdlib'], paths['platstdlib'], paths['purelib']])\n")

UNDER_UNITTEST = """
    import unittest

    def check(value):
        assert value == 2, "wrong value"

    class Tests(unittest.TestCase):
        def test_fails_in_a_helper(self):
            check(1)

        def test_fails_here(self):
            self.assertEqual(1, 2)

        def test_handles_its_own(self):
            try:
                check(3)
            except AssertionError:
                pass

        def test_passes(self):
            check(2)

    unittest.main(exit=False, verbosity=0)
"""


def test_user_unhandled_stops_where_the_users_code_lets_the_runner_catch(tmp_path):
    # unittest catches every exception of a test: mode 2 never stops. Mode 3 stops once per
    # failing test, in the innermost frame of the program's own code that the exception
    # leaves into library code: the test method whose call into the library's assertEqual
    # raised, and the helper's assert (unittest runs the tests in the order of their names).
    run = traced_like_plain(tmp_path, UNDER_UNITTEST, exception_mode=3, prelude=LIBRARY)
    assert exception_stops(run) == [
        ("exception", "prog.py", 11, "test_fails_here", "AssertionError"),
        ("exception", "prog.py", 4, "check", "AssertionError"),
    ]
    assert "FAILED (failures=2)" in run.stderr
    unhandled_only = traced_like_plain(tmp_path, UNDER_UNITTEST, prelude=LIBRARY)
    assert exception_stops(unhandled_only) == []


def test_user_unhandled_without_library_prefixes_is_the_unhandled_mode(tmp_path):
    run = traced_like_plain(tmp_path, UNDER_UNITTEST, exception_mode=3)
    assert exception_stops(run) == []
    escaping, expected = ESCAPING["through_several_frames"]
    run = traced_like_plain(tmp_path, escaping, exception_mode=3, prelude=LIBRARY)
    assert exception_stops(run) == [("exception",) + expected]
