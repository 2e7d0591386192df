"""Exception events at the edges of the settings: unknown exception modes, the built-in filter
of the regular-expression parser's own exception, location filters seen from every frame an
exception passes, always-stop types with handlers that do not count, catch-info lists that are
refused, emptied, half built or reset, catch-info instances that cannot be read, class
expressions that raise while the handlers are analysed, and which messages get recursion
headroom. Every traced program runs in a subprocess under the scripted server side; where the
program's own outcome matters it is compared with an untraced run."""

import sys

import pytest

from conftest import assert_stops, ok, run_plain, run_traced
from test_exceptions import INFO_CLASS, PRINTING

FREE = dict(first="continue_run", default="continue_run", when_elsewhere="continue_run")


def exception_stops(run):
    return [s for s in run.stops if s[0] == "exception"]


def same_outcome(tmp_path, run, program):
    plain = run_plain(tmp_path, program)
    assert (run.returncode, run.stdout) == (plain.returncode, plain.stdout)
    if plain.returncode != 0:
        assert run.stderr.splitlines()[-1] == plain.stderr.splitlines()[-1]
    else:
        assert run.stderr == plain.stderr


# ---- an exception mode that is not one of the known ones --------------------------------------

MIXED = """
    def same_frame():
        try:
            raise KeyError("same")
        except KeyError:
            pass

    def raising(kind):
        raise kind("out")

    def caller(kind):
        try:
            raising(kind)
        except Exception:
            pass

    same_frame()
    caller(ValueError)
    caller(OSError)
    caller(KeyError)
"""


@pytest.mark.parametrize("mode", [0, 7, -1, 3])
def test_unknown_modes_stop_only_where_the_lists_say(tmp_path, mode):
    # OSError is on the always-stop list: it stops where it is raised (that frame has no
    # clause for it), not in the caller, whose own clause catches it. KeyError is on both
    # lists, and the never-stop list is asked first. Nothing else stops, in mode 0 and in any
    # mode the core does not know.
    prelude = ("core.set_always_stop_excepts((OSError, KeyError))\n"
               "core.set_never_stop_excepts((KeyError,))")
    run = ok(run_traced(tmp_path, MIXED, exception_mode=mode, prelude=prelude, **FREE))
    assert_stops(exception_stops(run), [("exception", "prog.py", 8, "raising", "OSError")])


ESCAPING = """
    def fail():
        raise LookupError("escapes")

    print("before")
    fail()
"""


@pytest.mark.parametrize("mode", [7, 3])
def test_unknown_mode_stops_when_the_exception_leaves_the_bottom_frame(tmp_path, mode):
    log = tmp_path / "debug.txt"
    run = run_traced(tmp_path, ESCAPING, exception_mode=mode, stop_in_atexit=True, autoquit=1,
                     debug_file=str(log), after_stop="core.exiting_on_exception()", **FREE)
    assert "  leaving bottom frame\n" in log.read_text()
    assert run.after_stop == 1
    same_outcome(tmp_path, run, ESCAPING)


# ---- the regular-expression parser's own exception ---------------------------------------------

def parser_like_module(tmp_path, name):
    # A module whose name ends in "sre_parse.py", raising at line 134 and at line 136.
    lines = [f"# line {n}" for n in range(1, 131)]
    lines += [
        "def at_134(kind):",                  # 131
        "    x = kind",                       # 132
        "    y = x",                          # 133
        "    raise y('parser line')",         # 134
        "def at_136(kind):",                  # 135
        "    raise kind('other line')",       # 136
    ]
    (tmp_path / name).write_text("\n".join(lines) + "\n")


PARSER_USER = """
    import {module} as parser

    def use(f):
        try:
            f(ValueError)
        except ValueError:
            pass

    use(parser.at_134)
    use(parser.at_136)
"""


@pytest.mark.parametrize("module", ["sre_parse", "my_sre_parse"])
def test_exception_at_line_134_of_a_parser_file_is_never_reported(tmp_path, module):
    parser_like_module(tmp_path, module + ".py")
    program = PARSER_USER.format(module=module)
    probe = ("core.exception_loc_ignored(core.get_frame_file(frame), 134) if "
             "frame.f_code.co_name.startswith('at_') else None")
    run = ok(run_traced(tmp_path, program, exception_mode=1, files=["prog.py", module + ".py"],
                        probe=probe, **FREE))
    # Not at line 134, in no frame it passes through; line 136 stops in both frames; the
    # filter is not a user filter, so exception_loc_ignored still answers 0 for line 134.
    assert_stops(exception_stops(run),
                 [("exception", module + ".py", 136, "at_136", "ValueError", 0),
                  ("exception", "prog.py", 5, "use", "ValueError", None)])


def test_line_134_of_another_file_is_reported(tmp_path):
    parser_like_module(tmp_path, "sre_parser.py")
    run = ok(run_traced(tmp_path, PARSER_USER.format(module="sre_parser"), exception_mode=1,
                        files=["prog.py", "sre_parser.py"], **FREE))
    assert [s[1:3] for s in exception_stops(run)] == [
        ("sre_parser.py", 134), ("prog.py", 5), ("sre_parser.py", 136), ("prog.py", 5)]


# ---- location filters --------------------------------------------------------------------------

FILTERED = """
    import _scripted_shared as shared
    import tvantrel30pydebugstackless as core

    def leaf(n):
        raise ValueError(n)

    def mid(n):
        leaf(n)

    def run(n):
        try:
            mid(n)
        except ValueError:
            pass

    run(1)
    run(2)
    core.ignore_exception_loc(shared.added, 5, 0)
    run(3)
    core.ignore_exception_loc(shared.added, (2, 3), 1)
    run(4)
"""


def test_location_filter_hides_the_exception_in_every_frame_it_passes(tmp_path):
    # The first stop asks not to stop at this place again. The place is the innermost frame
    # of the exception, so the events in mid and run for the same exception are not
    # reported either, nor any later exception raised there, until the filter is removed
    # with the same file name text. A tuple location whose items add up to the line is the
    # same filter.
    add = ("shared.added = core.get_frame_file(frame); "
           "core.ignore_exception_loc(shared.added, frame.f_lineno, 1)")
    run = ok(run_traced(tmp_path, FILTERED, exception_mode=1, commands=[["exec", add]],
                        **FREE))
    assert_stops(exception_stops(run), [
        ("exception", "prog.py", 5, "leaf", "ValueError"),
        ("exception", "prog.py", 5, "leaf", "ValueError"),
        ("exception", "prog.py", 8, "mid", "ValueError"),
        ("exception", "prog.py", 12, "run", "ValueError"),
    ])


# ---- always-stop types and handlers that do not count ------------------------------------------

ALWAYS = """
    import _scripted_shared as shared

    def other_clause_only():
        try:
            raise KeyError("other clause")
        except ValueError:
            pass

    def caller():
        try:
            other_clause_only()
        except KeyError:
            pass

    def ignored_own_clause():
        try:
            raise KeyError("ignored")
        except KeyError:
            pass

    def counted_own_clause():
        try:
            raise KeyError("counted")
        except KeyError:
            pass

    shared.ignore(ignored_own_clause.__code__)
    caller()
    ignored_own_clause()
    counted_own_clause()
"""


@pytest.mark.parametrize("mode", [0, 2])
def test_always_stop_type_stops_unless_its_own_frame_has_a_clause_that_counts(tmp_path, mode):
    # A clause for another type does not count (the caller's handler does not either: only
    # the raising frame's own clauses are asked); nor does a clause of a frame whose handlers
    # are ignored. When the exception reaches the caller, the caller's own clause catches it:
    # no stop there. In mode 2 the unhandled rule finds the same handlers.
    prelude = ("core.set_always_stop_excepts((KeyError,))\n"
               "shared.ignore = lambda code: core.set_ignored_exception_handlers({code: 1})")
    run = ok(run_traced(tmp_path, ALWAYS, exception_mode=mode, prelude=prelude, **FREE))
    assert_stops(exception_stops(run),
                 [("exception", "prog.py", 5, "other_clause_only", "KeyError"),
                  ("exception", "prog.py", 17, "ignored_own_clause", "KeyError")])


IGNORED_FRAME = """
    import sys
    import _scripted_shared as shared

    def work(n):
        raise KeyError(n)

    def wrapper(n, ignore):
        if ignore:
            shared.ignore(sys._getframe())
        try:
            work(n)
        except KeyError:
            return "swallowed"

    print(wrapper(1, False))
    print(wrapper(2, True))
    print(wrapper(3, False))
"""


def test_ignored_handlers_by_frame_object_apply_to_that_frame_only(tmp_path):
    # The frame object as the key: only that call of wrapper has its handler disregarded; the
    # next call of the same code is a new frame and its handler counts again.
    prelude = "shared.ignore = lambda frame: core.set_ignored_exception_handlers({frame: 1})"
    run = ok(run_traced(tmp_path, IGNORED_FRAME, exception_mode=2, prelude=prelude, **FREE))
    # One stop, at the raise of the second call; that exception is not stopped on again when
    # wrapper reports it.
    assert_stops(exception_stops(run), [("exception", "prog.py", 5, "work", "KeyError")])
    assert run.stdout == "swallowed\n" * 3


# ---- the catch-info list through its method --------------------------------------------------

INFO = INFO_CLASS + """
REPORT = Info("report", "__main__", "*", True, False)
RUN_CHILD = Info("run_child", "*", "Runner", True, True)
"""

BOTH = [("exception", "prog.py", 5, "report", "KeyError"),
        ("exception", "prog.py", 14, "run_child", "KeyError")]


def catch_info_stops(tmp_path, setup, mode=4):
    run = ok(run_traced(tmp_path, PRINTING, exception_mode=mode, prelude=INFO + setup, **FREE))
    return [s[:5] for s in exception_stops(run)]


def test_catch_info_list_given_as_a_tuple_is_refused_and_the_old_one_kept(tmp_path):
    setup = """
core.set_exc_catch_info_list([REPORT, RUN_CHILD])
try:
    core.set_exc_catch_info_list((REPORT,))
except TypeError as e:
    assert "set_exc_catch_info_list" in str(e)
else:
    raise AssertionError("a tuple was accepted")
"""
    assert catch_info_stops(tmp_path, setup) == BOTH


def test_empty_catch_info_list_removes_the_index(tmp_path):
    setup = "core.set_exc_catch_info_list([REPORT, RUN_CHILD])\ncore.set_exc_catch_info_list([])\n"
    assert catch_info_stops(tmp_path, setup) == []


def test_catch_info_list_is_replaced_whole(tmp_path):
    setup = "core.set_exc_catch_info_list([REPORT])\ncore.set_exc_catch_info_list([RUN_CHILD])\n"
    assert catch_info_stops(tmp_path, setup) == BOTH[1:]


def test_catch_info_item_without_a_name_keeps_the_items_before_it(tmp_path):
    setup = """
try:
    core.set_exc_catch_info_list([REPORT, object(), RUN_CHILD])
except AttributeError:
    pass
else:
    raise AssertionError("an item without co_name was accepted")
"""
    assert catch_info_stops(tmp_path, setup) == BOTH[:1]


@pytest.mark.parametrize("mode", [4, 5])
def test_reset_keeps_the_catch_info_list(tmp_path, mode):
    setup = "core.set_exc_catch_info_list([REPORT, RUN_CHILD])\ncore.reset()\n"
    assert catch_info_stops(tmp_path, setup, mode) == BOTH


BROKEN_INFO = """
class Raising:
    def __init__(self, co_name, broken):
        self.co_name, self.broken = co_name, broken
    def __getattr__(self, name):
        if name == self.broken:
            raise RuntimeError("unreadable " + name)
        return {"mod_name": "*", "containing_class": "*", "prints": True,
                "parent": name == "parent" and self.co_name == "run_child"}[name]

class Missing(Raising):
    def __getattr__(self, name):
        if name == self.broken:
            raise AttributeError(name)
        return Raising.__getattr__(self, name)

class Falsy:
    def __bool__(self):
        raise ValueError("no truth value")

class BadTruth(Raising):
    def __getattr__(self, name):
        if name == self.broken:
            return Falsy()
        return Raising.__getattr__(self, name)

broken = []
for cls in (Raising, Missing, BadTruth):
    for attribute in ("mod_name", "containing_class", "prints", "parent"):
        broken.append((cls, attribute))
"""


@pytest.mark.parametrize("index", range(12))
@pytest.mark.parametrize("mode", [4, 5])
def test_catch_info_instance_that_cannot_be_read_never_stops_nor_raises(tmp_path, index, mode):
    # Each instance breaks one attribute (raising, missing, or a truth value that raises).
    # Whatever its failure path, the search or the reading ends with no entry, so no stop
    # for that function, and the program runs exactly as untraced. A valid instance after it
    # with the same name: whether the search reaches it depends on which attribute broke.
    setup = BROKEN_INFO + f"""
cls, attribute = broken[{index}]
core.set_exc_catch_info_list([cls("report", attribute), cls("run_child", attribute)])
"""
    run = run_traced(tmp_path, PRINTING, exception_mode=mode, prelude=INFO + setup, **FREE)
    assert exception_stops(run) == []
    same_outcome(tmp_path, run, PRINTING)


def test_broken_instance_ends_the_search_only_once_its_module_matched(tmp_path):
    setup = BROKEN_INFO + """
core.set_exc_catch_info_list([Missing("report", "containing_class"), REPORT,
                              Info("run_child", "elsewhere", None, True, True), RUN_CHILD])
"""
    # report: the module of the first instance matches ("*") and its class is missing: no
    # entry. run_child: the first instance's module does not match, so its class (None,
    # which would be a failure) is never read, and the second instance is used.
    assert catch_info_stops(tmp_path, setup) == BOTH[1:]


# ---- class expressions that raise while the handlers are analysed ------------------------------

RAISING_CLASS_EXPRESSION = """
    import tvantrel30pydebugstackless as core

    class Holder:
        # Raises only while the debugger analyses the handlers (inside the trace function).
        @property
        def Cls(self):
            if core.get_tstate_tracing():
                raise LookupError("evaluated by the analysis")
            return KeyError

    class Lazy:
        def __getattr__(self, name):
            if core.get_tstate_tracing():
                raise AttributeError(name)
            return KeyError

    holder, lazy = Holder(), Lazy()

    def by_property():
        try:
            raise KeyError("p")
        except holder.Cls as e:
            print("caught", repr(e))

    def by_getattr():
        try:
            raise KeyError("g")
        except lazy.Missing as e:
            print("caught", repr(e))

    by_property()
    by_getattr()
    import sys
    print(sys.exc_info())
"""


def test_class_expression_that_raises_in_the_analysis_counts_as_not_matching(tmp_path):
    # Mode 2: the clause cannot be evaluated by the analysis, so it is taken as not catching
    # and the exception as unhandled: a stop. The error from the evaluation is cleared: the
    # program itself evaluates the clause, catches its own exception and sees nothing else.
    run = ok(run_traced(tmp_path, RAISING_CLASS_EXPRESSION, exception_mode=2, **FREE))
    assert_stops(exception_stops(run), [("exception", "prog.py", 21, "by_property", "KeyError"),
                                        ("exception", "prog.py", 27, "by_getattr", "KeyError")])
    assert run.stdout == "caught KeyError('p')\ncaught KeyError('g')\n(None, None, None)\n"
    same_outcome(tmp_path, run, RAISING_CLASS_EXPRESSION)


# ---- recursion headroom ------------------------------------------------------------------------

ROOM = """
    import sys

    def raise_it(exc):
        try:
            raise exc
        except BaseException:
            pass

    def at_depth(left, exc):
        # Calls down until `left` frames remain below the limit, then raises there.
        def down():
            try:
                down()
            except RecursionError:
                raise_it(exc)
        try:
            down()
        except RecursionError:
            pass

    raise_it(RuntimeError("maximum recursion depth exceeded (made up)"))
    raise_it(ValueError("shallow"))
    at_depth(0, ValueError("at the limit"))
    at_depth(0, KeyError("at the limit"))
    print("limit", sys.getrecursionlimit())
"""


def test_room_for_the_core_follows_the_depth_not_the_exception(tmp_path):
    # Whatever the exception, a stop near the recursion limit leaves its callback room to nest
    # calls; and nowhere does the program or the callback see another recursion limit.
    probe = ("[sys.getrecursionlimit(), "
             "(lambda f: f(f, 20))(lambda f, n: n == 0 or bool(f(f, n - 1)))]")
    run = ok(run_traced(tmp_path, ROOM, exception_mode=1, probe=probe, **FREE))
    limit = sys.getrecursionlimit()
    stops = [(s[4], s[-1]) for s in exception_stops(run) if s[3] == "raise_it"]
    assert stops == [
        ("RuntimeError", [limit, True]),
        ("ValueError", [limit, True]),
        ("ValueError", [limit, True]),
        ("KeyError", [limit, True]),
    ]
    assert run.stdout == f"limit {limit}\n"
    same_outcome(tmp_path, run, ROOM)
