"""Exception events: which exceptions stop the program, by exception mode, stop lists,
handlers predicted from the byte code, ignored locations and handlers, the catch-info list;
exceptions leaving the bottom frame; the recursion-depth headroom. Every traced program runs
in a subprocess under the scripted server side."""

import sys

import pytest

from conftest import assert_stops, ok, run_plain, run_traced

FREE = dict(first="continue_run", default="continue_run", when_elsewhere="continue_run")


def exception_stops(run):
    return [s for s in run.stops if s[0] == "exception"]


# ---- stop lists -----------------------------------------------------------------------------

NEVER = """
    def f():
        try:
            raise KeyError("k")
        except KeyError:
            pass

    f()
"""


def test_always_mode_stops_even_on_a_never_stop_type(tmp_path):
    run = ok(run_traced(tmp_path, NEVER, exception_mode=1,
                        prelude="core.set_never_stop_excepts((KeyError,))", **FREE))
    assert_stops(run.stops, [("exception", "prog.py", 3, "f", "KeyError")])


def test_never_stop_type_does_not_stop_in_unhandled_mode(tmp_path):
    program = """
        def f():
            raise KeyError("k")

        try:
            f()
        except ValueError:
            pass
    """
    run = run_traced(tmp_path, program, exception_mode=2,
                     prelude="core.set_never_stop_excepts((LookupError,))", **FREE)
    assert exception_stops(run) == []
    assert run.returncode == 1 and "KeyError" in run.stderr


ALWAYS = """
    def caught_here():
        try:
            raise KeyError("here")
        except KeyError:
            pass

    def raising():
        raise KeyError("outer")

    def caught_by_caller():
        try:
            raising()
        except KeyError:
            pass

    def caught_by_other_clause():
        try:
            raise KeyError("other")
        except ValueError:
            pass
        except LookupError:
            pass

    caught_here()
    caught_by_caller()
    caught_by_other_clause()
"""


def test_always_stop_type_caught_by_its_own_frame_does_not_stop(tmp_path):
    # Mode 0 with KeyError on the always-stop list: a clause of the raising frame that
    # catches it (by the type or a base class) means no stop; a handler only in a caller does
    # not count.
    run = ok(run_traced(tmp_path, ALWAYS, exception_mode=0,
                        prelude="core.set_always_stop_excepts((KeyError,))", **FREE))
    assert_stops(exception_stops(run), [("exception", "prog.py", 8, "raising", "KeyError")])


# ---- unhandled mode --------------------------------------------------------------------------

UNHANDLED = """
    def inner(kind):
        raise kind("x")

    def middle(kind):
        inner(kind)

    def outer(kind):
        try:
            middle(kind)
        except KeyError:
            return "caught"
        finally:
            pass

    def only_finally():
        try:
            middle(ValueError)
        finally:
            print("cleanup")

    print(outer(KeyError))
    try:
        only_finally()
    except ValueError:
        print("caught at the top")
    only_finally()
"""


def test_unhandled_mode_stops_only_where_no_handler_catches(tmp_path):
    # KeyError: a handler two frames out catches it, no stop. ValueError: only a finally
    # around it in only_finally, caught at the top the first time (no stop), uncaught the
    # second time: a stop in the raising frame, with every frame still on the stack.
    run = run_traced(tmp_path, UNHANDLED, exception_mode=2,
                     probe="[f.name for f in __import__('traceback').extract_stack(frame)]",
                     **FREE)
    # The exception is reported in every frame it passes through, and in each of them no
    # handler further out catches it: one stop, in the raising frame with the whole stack
    # still there; the outer frames that report the same exception again do not stop.
    stops = exception_stops(run)
    assert [s[:5] for s in stops] == [("exception", "prog.py", 2, "inner", "ValueError")]
    assert stops[0][-1][-4:] == ["<module>", "only_finally", "middle", "inner"]
    plain = run_plain(tmp_path, UNHANDLED)
    assert (run.returncode, run.stdout) == (plain.returncode, plain.stdout)
    assert run.stderr.splitlines()[-1] == plain.stderr.splitlines()[-1]


def test_ignored_handlers_do_not_count_as_catching(tmp_path):
    program = """
        import _scripted_shared as shared

        def work():
            raise KeyError("k")

        def wrapper():
            try:
                work()
            except KeyError:
                return "swallowed"

        shared.ignore(wrapper.__code__)
        print(wrapper())
    """
    prelude = ("shared.ignore = lambda code: core.set_ignored_exception_handlers({code: 1})")
    run = ok(run_traced(tmp_path, program, exception_mode=2, prelude=prelude, **FREE))
    # Stopped on in work, where wrapper's own handler does not count; once stopped on, the
    # same exception reported again in wrapper does not stop a second time.
    assert_stops(exception_stops(run), [("exception", "prog.py", 4, "work", "KeyError")])
    assert run.stdout == "swallowed\n"


def test_ignored_location_is_not_reported(tmp_path):
    program = """
        import _scripted_shared as shared

        def f(n):
            raise ValueError(n)

        for n in range(3):
            try:
                f(n)
            except ValueError:
                pass
    """
    # The first stop asks not to stop at this place again.
    command = ["exec", "core.ignore_exception_loc(core.get_frame_file(frame), frame.f_lineno, 1)"]
    run = ok(run_traced(tmp_path, program, exception_mode=1, commands=[command], **FREE))
    assert_stops(exception_stops(run), [("exception", "prog.py", 4, "f", "ValueError")])


# ---- the bottom frame -----------------------------------------------------------------------

ESCAPING = """
    def fail():
        raise LookupError("escapes")

    print("before")
    fail()
"""


@pytest.mark.parametrize("autoquit, exiting", [(1, 1), (0, 0)])
def test_exception_leaving_the_bottom_frame_stops_even_in_never_mode(tmp_path, autoquit, exiting):
    log = tmp_path / "debug.txt"
    run = run_traced(tmp_path, ESCAPING, exception_mode=0, stop_in_atexit=True, autoquit=autoquit,
                     debug_file=str(log), after_stop="core.exiting_on_exception()", **FREE)
    assert "  leaving bottom frame\n" in log.read_text()
    assert run.after_stop == exiting
    # The program ends exactly as it would untraced.
    plain = run_plain(tmp_path, ESCAPING)
    assert (run.returncode, run.stdout) == (plain.returncode, plain.stdout)
    assert run.stderr.splitlines()[-1] == plain.stderr.splitlines()[-1] == \
        "LookupError: escapes"


# ---- recursion depth ---------------------------------------------------------------------------

# What a stop's callback can still do, as a probe: nest 20 calls (as the server side's own
# code does), and read the recursion limit.
ROOM_PROBE = ("[sys.getrecursionlimit(), "
              "(lambda f: f(f, 20))(lambda f, n: n == 0 or bool(f(f, n - 1)))]")


def test_recursion_error_stop_has_room_for_the_callback(tmp_path):
    program = """
        import sys

        def deep(n):
            return deep(n + 1)

        before = sys.getrecursionlimit()
        try:
            deep(0)
        except RecursionError:
            pass
        print(sys.getrecursionlimit() == before)
    """
    run = ok(run_traced(tmp_path, program, exception_mode=1, max_stops=1, probe=ROOM_PROBE,
                        **FREE))
    assert run.stdout == "True\n"
    first = exception_stops(run)[0]
    assert first[4] == "RecursionError"
    # The callback nests its calls at the limit, and the limit is the program's own.
    assert first[-1] == [sys.getrecursionlimit(), True]


# ---- the catch-info list (modes 4 and 5) ------------------------------------------------------

PRINTING = """
    import traceback

    def report(f):
        try:
            f()
        except Exception:
            traceback.print_exc(limit=0)

    def boom():
        raise KeyError("printed")

    class Runner:
        def run_child(self, f):
            f()

    def parent_reports(f):
        try:
            Runner().run_child(f)
        except Exception:
            print("caught by the parent")

    report(boom)
    parent_reports(boom)
"""

# A catch-info class of the server side's kind: the attributes the core reads.
INFO_CLASS = """
class Info:
    def __init__(self, co_name, mod_name, containing_class, prints, parent):
        self.co_name, self.mod_name = co_name, mod_name
        self.containing_class = containing_class
        self.prints, self.parent = prints, parent
"""

CATCH_INFO = INFO_CLASS + """
core.set_exc_catch_info_list([
    Info("report", "__main__", "*", True, False),
    Info("run_child", "*", "Runner", True, True),
])
"""


@pytest.mark.parametrize("mode", [4, 5])
def test_catch_info_stops_where_the_frame_or_its_parent_prints(tmp_path, mode):
    run = ok(run_traced(tmp_path, PRINTING, exception_mode=mode, prelude=CATCH_INFO, **FREE))
    # report() prints what it catches: a stop at the exception event in report. run_child
    # leaves the printing to its caller: a stop when the exception leaves run_child.
    stops = [s[:5] for s in exception_stops(run)]
    assert stops == [("exception", "prog.py", 5, "report", "KeyError"),
                     ("exception", "prog.py", 14, "run_child", "KeyError")]


def test_catch_info_does_not_apply_in_other_modes(tmp_path):
    run = ok(run_traced(tmp_path, PRINTING, exception_mode=0, prelude=CATCH_INFO, **FREE))
    assert exception_stops(run) == []


# ---- the generated corpus ----------------------------------------------------------------------

def test_unhandled_mode_stops_exactly_on_the_raises_that_escape(tmp_path):
    # Every program of the corpus is first run untraced, which tells for each raise whether
    # it really escaped the program; then it runs under the core in mode 2. For every shape
    # the analysis reads, the exception callback must run for exactly the escaping raises.
    # Shapes it deliberately does not read (a call in the class expression) count as not
    # catching: there the callback may run for a raise that is caught, never miss one.
    import json
    import os
    import subprocess

    out = tmp_path / "corpus.json"
    runner = os.path.join(os.path.dirname(os.path.abspath(__file__)), "exc_corpus_run.py")
    subprocess.run([sys.executable, runner, str(out), "600", "200"], check=True, timeout=300,
                   capture_output=True, text=True, cwd=tmp_path)
    results = json.loads(out.read_text())
    plain = [r for r in results if r["category"] == "plain"]
    unknown = [r for r in results if r["category"] == "unknown"]
    assert len(plain) == 540 and len(unknown) == 60
    escaping = sum(len(r["escaped"]) for r in plain)
    caught = sum(r["raised"] for r in plain) - escaping
    assert escaping > 50 and caught > 200  # the corpus really has both kinds
    wrong = [r for r in plain if r["fired"] != r["escaped"]]
    assert wrong == []
    missed = [r for r in unknown if not set(r["escaped"]) <= set(r["fired"])]
    assert missed == []
    # Raises that pass C code and `with` blocks (suppressing and not): where only "may be
    # caught" is known at the raise, the outer frames decide; still exactly the escaping.
    boundary = [r for r in results if r["category"] == "boundary"]
    assert len(boundary) == 200
    escaping = sum(len(r["escaped"]) for r in boundary)
    assert escaping > 50 and sum(r["raised"] for r in boundary) - escaping > 50
    wrong = [r for r in boundary if r["fired"] != r["escaped"]]
    assert wrong == []
