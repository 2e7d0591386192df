"""Breakpoints: the table methods, the hit test, and file names given in any spelling.

The table methods (set_break, clear_breaks, enable_breaks, ignore_breaks, set_breaks_cond,
clear_all_breaks, get_breaks, get_file_breaks, get_changed_bps_lists) are plain table
operations and are tested in this process. Everything that needs a traced program runs it in
a subprocess under scripted_server.py with continue_run from the start, so that every stop
is a breakpoint stop: ("line", file, line, function), followed by what the test records
(the changed-breakpoint lists the callback received, a probe's value).

How the expectations are made: a line event stops when an enabled breakpoint of the event's
line names the frame's file (by any spelling of it) and its condition and ignore count let it
stop; every pass over an enabled breakpoint's line counts a hit; an ignored pass or a stop of
a temporary breakpoint changes the record; the callbacks receive the lists of the records
changed since the last stop. Set TRACE_DRY_RUN=1 to print the actual lists.
"""

import os
import re
import textwrap

import pytest

import tvantrel30pydebugstackless as core
from conftest import assert_stops, ok, record_lines, run_plain, run_traced, write_program
from core_args import init_args

BREAK_METHODS = ("set_break", "clear_breaks", "enable_breaks", "ignore_breaks",
                 "set_breaks_cond", "clear_all_breaks", "get_breaks", "get_file_breaks",
                 "get_changed_bps_lists")


def marked(source, tag):
    """The line number of the line of `source` (as write_program writes it) that carries the
    comment `# tag`."""
    lines = textwrap.dedent(source).lstrip("\n").splitlines()
    found = [i + 1 for i, text in enumerate(lines) if text.rstrip().endswith("# " + tag)]
    assert len(found) == 1, f"marker {tag!r} found {len(found)} times"
    return found[0]


def line(number, function="<module>", file="prog.py", *extra):
    return ("line", file, number, function) + tuple(extra)


# ---- the table methods, in this process -------------------------------------------------


@pytest.fixture
def table():
    core.init(*init_args())
    yield core
    core.reset()


def test_method_docstrings():
    assert core.set_break.__doc__ == (
        "Set a breakpoint at given file/line.  Pass in file, line, enabled flag,\n"
        "temporary flag, conditional as string (or None), and ignore count.  If\n"
        "a breakpoint exists, its values will be updated accordingly.  The new breakpoint\n"
        "id is returned as int.")
    assert core.clear_breaks.__doc__ == "Clear all breakpoints at given file/line"
    assert core.enable_breaks.__doc__ == (
        "Enable/disable all breakpoints at given file and line number")
    assert core.ignore_breaks.__doc__ == (
        "Ignore all breakpoints at given file and line number for a given number\nof hits")
    assert core.set_breaks_cond.__doc__ == (
        "Set conditional for all breakpoints at given file and line number; empty string to "
        "set no conditional")
    assert core.clear_all_breaks.__doc__ == "Clear all defined breakpoints"
    assert core.get_breaks.__doc__ == (
        "Get all breakpoints at given file and line number: Returns sequence of\n"
        "(id, enabled, temporary, cond, ignore_count, hit_count) tuples")
    assert core.get_file_breaks.__doc__ == (
        "Get all breakpoints in given file: Returns sequence of (lineno, id\n"
        "enabled, temporary, cond, ignore_count, hit_count) tuples")
    assert core.get_changed_bps_lists.__doc__ == "Gets and clears the changed bp lists."


def test_a_second_set_break_on_a_line_adds_a_breakpoint_in_front(table):
    first = core.set_break("a.py", 10, 1, 0, None, 0)
    second = core.set_break("a.py", 10, 0, 1, "x > 1", 3)
    assert (first, second) == (1, 2)
    # Nothing is updated or merged: two records, newest first.
    assert core.get_breaks("a.py", 10) == [(2, 0, 1, "x > 1", 3, 0), (1, 1, 0, None, 0, 0)]
    assert core.get_file_breaks("a.py") == [(10, 2, 0, 1, "x > 1", 3, 0),
                                            (10, 1, 1, 0, None, 0, 0)]


def test_listings_of_lines_and_files(table):
    core.set_break("a.py", 3, 1, 0, None, 0)
    core.set_break("a.py", 7, 1, 1, "i == 2", 4)
    core.set_break("b.py", 3, 0, 0, None, 0)
    assert core.get_breaks("a.py", 3) == [(1, 1, 0, None, 0, 0)]
    assert core.get_breaks("a.py", 7) == [(2, 1, 1, "i == 2", 4, 0)]
    assert core.get_breaks("a.py", 8) == []
    assert core.get_breaks("c.py", 3) == []
    assert sorted(core.get_file_breaks("a.py")) == [(3, 1, 1, 0, None, 0, 0),
                                                    (7, 2, 1, 1, "i == 2", 4, 0)]
    assert core.get_file_breaks("b.py") == [(3, 3, 0, 0, None, 0, 0)]
    assert core.get_file_breaks("c.py") == []
    assert isinstance(core.get_breaks("a.py", 3), list)
    assert isinstance(core.get_file_breaks("a.py"), list)


def test_flags_keep_their_low_16_bits(table):
    core.set_break("a.py", 1, 0x10000, 0x10001, None, 0)
    assert core.get_breaks("a.py", 1) == [(1, 0, 1, None, 0, 0)]
    core.set_break("a.py", 2, -1, 2, None, 0)
    assert core.get_breaks("a.py", 2) == [(2, 1, 1, None, 0, 0)]


def test_per_line_methods_match_the_file_name_by_its_exact_text(table):
    core.set_break("a.py", 5, 1, 0, None, 0)
    core.set_break("./a.py", 5, 1, 0, None, 0)
    assert core.get_breaks("a.py", 5) == [(1, 1, 0, None, 0, 0)]
    assert core.get_breaks("./a.py", 5) == [(2, 1, 0, None, 0, 0)]
    core.enable_breaks("./a.py", 5, 0)
    core.ignore_breaks("./a.py", 5, 9)
    core.set_breaks_cond("./a.py", 5, "c")
    assert core.get_breaks("a.py", 5) == [(1, 1, 0, None, 0, 0)]
    assert core.get_breaks("./a.py", 5) == [(2, 0, 0, "c", 9, 0)]
    core.clear_breaks("./a.py", 5)
    assert core.get_breaks("a.py", 5) == [(1, 1, 0, None, 0, 0)]
    assert core.get_breaks("./a.py", 5) == []


def test_breakpoints_of_two_files_on_one_line_are_cleared_apart(table):
    core.set_break("a.py", 4, 1, 0, None, 0)
    core.set_break("b.py", 4, 1, 0, None, 0)
    core.set_break("a.py", 4, 1, 0, None, 0)
    core.set_break("b.py", 4, 1, 0, "q", 0)
    assert core.clear_breaks("a.py", 4) is None
    assert core.get_breaks("a.py", 4) == []
    # The other file's records stay, in their order.
    assert core.get_breaks("b.py", 4) == [(4, 1, 0, "q", 0, 0), (2, 1, 0, None, 0, 0)]
    core.clear_breaks("b.py", 4)
    assert core.get_breaks("b.py", 4) == []
    # Clearing a line or file with no breakpoint does nothing.
    core.clear_breaks("b.py", 4)
    core.clear_breaks("z.py", 99)
    assert core.set_break("b.py", 4, 1, 0, None, 0) == 5


def test_enable_breaks_sets_every_breakpoint_of_the_file_and_line(table):
    core.set_break("a.py", 6, 1, 0, None, 0)
    core.set_break("a.py", 6, 0, 0, None, 0)
    core.set_break("b.py", 6, 1, 0, None, 0)
    # Disabling: the core's own answer is 0 here, but the method answers None either way.
    assert core.enable_breaks("a.py", 6, 0) is None
    assert [b[1] for b in core.get_breaks("a.py", 6)] == [0, 0]
    assert core.get_breaks("b.py", 6) == [(3, 1, 0, None, 0, 0)]
    assert core.enable_breaks("a.py", 6, 1) is None
    assert [b[1] for b in core.get_breaks("a.py", 6)] == [1, 1]
    core.enable_breaks("a.py", 6, 0)
    # Any non-zero flag enables, even one whose low 16 bits are 0.
    core.enable_breaks("a.py", 6, 0x10000)
    assert [b[1] for b in core.get_breaks("a.py", 6)] == [1, 1]
    assert core.enable_breaks("a.py", 77, 1) is None  # no breakpoint there


def test_ignore_breaks_sets_the_count_of_every_breakpoint_of_the_file_and_line(table):
    core.set_break("a.py", 8, 1, 0, None, 1)
    core.set_break("a.py", 8, 1, 0, None, 5)
    core.set_break("b.py", 8, 1, 0, None, 2)
    assert core.ignore_breaks("a.py", 8, 3) is None
    assert [b[4] for b in core.get_breaks("a.py", 8)] == [3, 3]
    assert core.get_breaks("b.py", 8)[0][4] == 2
    core.ignore_breaks("a.py", 8, 0)
    assert [b[4] for b in core.get_breaks("a.py", 8)] == [0, 0]


def test_set_breaks_cond_none_removes_and_empty_text_stores_an_empty_condition(table):
    core.set_break("a.py", 9, 1, 0, "x", 0)
    core.set_break("a.py", 9, 1, 0, None, 0)
    assert core.set_breaks_cond("a.py", 9, "y > 2") is None
    assert [b[3] for b in core.get_breaks("a.py", 9)] == ["y > 2", "y > 2"]
    core.set_breaks_cond("a.py", 9, None)
    assert [b[3] for b in core.get_breaks("a.py", 9)] == [None, None]
    core.set_breaks_cond("a.py", 9, "")
    assert [b[3] for b in core.get_breaks("a.py", 9)] == ["", ""]
    assert core.get_file_breaks("a.py")[0][4] == ""
    core.set_break("a.py", 10, 1, 0, "", 0)
    assert core.get_breaks("a.py", 10) == [(3, 1, 0, "", 0, 0)]
    core.set_breaks_cond("a.py", 9, "\u00e9t\u00e9 == 1")
    assert core.get_breaks("a.py", 9)[0][3] == "\u00e9t\u00e9 == 1"


def test_table_methods_mark_nothing_changed_and_the_lists_empty_once(table):
    assert core.get_changed_bps_lists() == ([], [])
    core.set_break("a.py", 2, 1, 0, None, 0)
    core.enable_breaks("a.py", 2, 0)
    core.ignore_breaks("a.py", 2, 4)
    core.set_breaks_cond("a.py", 2, "c")
    core.set_break("a.py", 3, 1, 1, None, 0)
    core.clear_breaks("a.py", 3)
    lists = core.get_changed_bps_lists()
    assert lists == ([], [])
    assert isinstance(lists, tuple) and all(isinstance(x, list) for x in lists)
    assert core.get_changed_bps_lists() == ([], [])


def test_clear_all_breaks_empties_the_table_and_ids_go_on(table):
    for lineno in (1, 2, 2, 300, -4):
        core.set_break("a.py", lineno, 1, 0, None, 0)
    core.set_break("b.py", 2, 1, 0, None, 0)
    assert core.clear_all_breaks() is None
    assert core.get_file_breaks("a.py") == []
    assert core.get_file_breaks("b.py") == []
    assert core.get_breaks("a.py", 2) == []
    # Ids are never reused while the core lives.
    assert core.set_break("a.py", 2, 1, 0, None, 0) == 7
    assert core.get_breaks("a.py", 2) == [(7, 1, 0, None, 0, 0)]
    core.clear_all_breaks()
    core.clear_all_breaks()  # twice is harmless


def test_ids_start_at_1_again_after_reset(table):
    core.set_break("a.py", 1, 1, 0, None, 0)
    core.set_break("a.py", 2, 1, 0, None, 0)
    core.reset()
    assert core.get_file_breaks("a.py") == []
    assert core.set_break("a.py", 2, 1, 0, None, 0) == 1
    core.init(*init_args())
    assert core.get_file_breaks("a.py") == []
    assert core.set_break("a.py", 2, 1, 0, None, 0) == 1


def test_any_line_number_is_stored(table):
    for lineno in (0, -1, -2 ** 31, 2 ** 31 - 1):
        core.set_break("a.py", lineno, 1, 0, None, 0)
    assert sorted(b[0] for b in core.get_file_breaks("a.py")) == [-2 ** 31, -1, 0, 2 ** 31 - 1]
    assert core.get_breaks("a.py", -2 ** 31) == [(3, 1, 0, None, 0, 0)]
    core.clear_breaks("a.py", -1)
    assert core.get_breaks("a.py", -1) == []


@pytest.mark.parametrize("method, args, word", [
    ("set_break", (1, 1, 1, 0, None, 0), "tracer_set_break"),
    ("set_break", (b"a.py", 1, 1, 0, None, 0), "tracer_set_break"),
    ("set_break", ("a.py", "1", 1, 0, None, 0), None),
    ("set_break", ("a.py", 1.5, 1, 0, None, 0), None),
    ("set_break", ("a.py", 1, 1, 0, None, "0"), None),
    ("set_break", ("a.py", 1, 1, 0, None), "tracer_set_break"),
    ("set_break", ("a.py", 1, 1, 0, None, 0, 7), "tracer_set_break"),
    ("clear_breaks", (None, 1), "tracer_clear_breaks"),
    ("clear_breaks", ("a.py", None), None),
    ("enable_breaks", ("a.py", 1, "1"), None),
    ("ignore_breaks", ("a.py", 1, 2.0), None),
    ("ignore_breaks", ("a.py", 1), "tracer_ignore_breaks"),
    ("set_breaks_cond", (3, 1, "x"), "tracer_set_breaks_cond"),
    ("get_breaks", ("a.py",), "tracer_get_breaks"),
    ("get_breaks", ("a.py", "1"), None),
    ("get_file_breaks", (1,), "tracer_get_file_breaks"),
    ("get_file_breaks", (), "tracer_get_file_breaks"),
    ("get_changed_bps_lists", (1,), "get_changed_bps_lists"),
])
def test_argument_errors_are_the_parser_errors_of_the_formats(table, method, args, word):
    # Wrong strings and argument counts name the method as its format does; a wrong integer
    # is the interpreter's own conversion error.
    with pytest.raises(TypeError, match=re.escape(word + "()") if word else None):
        getattr(core, method)(*args)
    assert core.get_file_breaks("a.py") == []


def test_line_numbers_beyond_an_int_are_refused(table):
    with pytest.raises(OverflowError):
        core.set_break("a.py", 2 ** 40, 1, 0, None, 0)
    assert core.get_file_breaks("a.py") == []


def test_file_names_with_a_nul_byte_are_refused(table):
    with pytest.raises(ValueError):
        core.set_break("a\x00b.py", 1, 1, 0, None, 0)


def test_a_condition_that_cannot_become_text_fails_and_uses_up_an_id(table):
    # A lone surrogate has no UTF-8 form: the record cannot be made.
    with pytest.raises(MemoryError, match="Out of memory"):
        core.set_break("a.py", 1, 1, 0, "\udcff", 0)
    assert core.get_file_breaks("a.py") == []
    # The id was taken before the record was made.
    assert core.set_break("a.py", 1, 1, 0, None, 0) == 2


def test_a_condition_that_is_not_a_string_fails_and_uses_up_an_id(table):
    # The condition is converted by the string conversion, which fails for a non-string:
    # the record is not made (MemoryError "Out of memory", as for any failed creation) and
    # its id was already taken.
    with pytest.raises(MemoryError, match="Out of memory"):
        core.set_break("a.py", 1, 1, 0, 42, 0)
    assert core.get_file_breaks("a.py") == []
    assert core.set_break("a.py", 1, 1, 0, None, 0) == 2


def test_a_file_name_of_40000_characters_is_kept_whole(table):
    name = "/" + "d" * 39995 + "/x.py"
    assert len(name) == 40001
    bp = core.set_break(name, 3, 1, 0, None, 0)
    assert core.get_breaks(name, 3) == [(bp, 1, 0, None, 0, 0)]
    assert core.get_file_breaks(name) == [(3, bp, 1, 0, None, 0, 0)]
    assert core.get_breaks(name[:-1], 3) == []
    core.clear_breaks(name, 3)
    assert core.get_file_breaks(name) == []


def test_file_names_beyond_the_path_buffers_in_a_traced_program(tmp_path):
    # Module code and functions whose file names are 32000 to 40001 bytes long, registered and
    # run under breakpoints on those names: nothing overflows, the program runs normally.
    # Such names cannot be resolved, so no breakpoint of an ordinary frame matches them.
    source = """
    import types
    import tvantrel30pydebugstackless as core
    LONG = "/" + "d" * 39995 + "/x.py"
    for name in (LONG, LONG[:32000], LONG[:32001], LONG[:31999]):
        exec(compile("v = 1\\nv = 2\\n", name, "exec"), {"__file__": name})
        module = types.ModuleType("m")
        module.__file__ = name
        print(core.register_module(module) is None or len(core.register_module(module)))
    print("done")
    """
    long_name = "/" + "d" * 39995 + "/x.py"
    breaks = [[name, 1, 1, 0, None, 0] for name in (long_name, long_name[:32000])]
    run = run_traced(tmp_path, source, breaks=breaks, files=["x.py"], **CONTINUE)
    assert run.returncode == 0, run.stderr
    assert run.stdout.splitlines()[-1] == "done"
    assert len(run.stdout.splitlines()) == 5


# ---- traced runs ----------------------------------------------------------------------------

CONTINUE = dict(first="continue_run", default="continue_run", when_elsewhere="continue_run")


def traced(tmp_path, source, breaks, modules=None, **config):
    """Traces `source` as prog.py with `modules` ({relative path: source}) written beside it,
    the breakpoints `breaks` ([file, line, enabled, temporary, cond, ignore], file names as
    given: relative names are relative to the test's folder, the traced program's working
    folder) and continue_run from the start. The traced run must print what an untraced run
    prints."""
    program = write_program(tmp_path, source)
    for name, text in (modules or {}).items():
        os.makedirs(os.path.dirname(str(tmp_path / name)), exist_ok=True)
        write_program(tmp_path, text, name)
    config = dict(CONTINUE, **config)
    run = run_traced(tmp_path, program, breaks=breaks, **config)
    plain = run_plain(tmp_path, program)
    assert run.stdout == plain.stdout, run.stderr
    assert run.returncode == plain.returncode, run.stderr
    return run


LOOP = """
def work(n):
    total = 0
    for i in range(n):
        total += i  # loop
    return total  # after

print(work(4))
"""


def test_ignore_count_2_over_four_passes(tmp_path):
    prog = str(tmp_path / "prog.py")
    at = marked(LOOP, "loop")
    run = traced(tmp_path, LOOP, [[prog, at, 1, 0, None, 2]], record_changed=True,
                 probe="frame.f_locals['i']", after_stop=f"core.get_breaks({prog!r}, {at})")
    # The first two passes are ignored (each a change of the record), the third and fourth
    # stop; each stop's callback receives the record as it stands.
    assert_stops(run.stops, [
        line(at, "work", "prog.py", [[], [[prog, at, 1, 1, 0, None, 0, 3]]], 2),
        line(at, "work", "prog.py", [[], [[prog, at, 1, 1, 0, None, 0, 4]]], 3),
    ])
    assert run.after_stop == [[1, 1, 0, None, 0, 4]]


def test_a_temporary_breakpoint_stops_once_and_is_reported_deleted(tmp_path):
    prog = str(tmp_path / "prog.py")
    at = marked(LOOP, "loop")
    after = marked(LOOP, "after")
    run = traced(tmp_path, LOOP, [[prog, at, 1, 1, None, 0], [prog, after, 1, 0, None, 0]],
                 record_changed=True, probe=f"core.get_file_breaks({prog!r})")
    assert_stops(run.stops, [
        # It fired: out of the table at once, and its id comes in the first list.
        line(at, "work", "prog.py", [[1], []], [[after, 2, 1, 0, None, 0, 0]]),
        # Nothing left to report at the next stop.
        line(after, "work", "prog.py", [[], [[prog, after, 2, 1, 0, None, 0, 1]]],
             [[after, 2, 1, 0, None, 0, 1]]),
    ])


def test_a_temporary_breakpoint_that_fires_after_an_unreported_hit_leaves_the_table(tmp_path):
    # The first pass counts a hit (the condition is false): the record joins the changed list
    # and no stop reports it. The second pass fires it; it must leave the table although it
    # was on the list already, or later passes would meet a freed record.
    prog = str(tmp_path / "prog.py")
    at = marked(LOOP, "loop")
    after = marked(LOOP, "after")
    run = traced(tmp_path, LOOP, [[prog, at, 1, 1, "i >= 1", 0], [prog, after, 1, 0, None, 0]],
                 record_changed=True, probe=f"core.get_breaks({prog!r}, {at})")
    assert_stops(run.stops, [
        line(at, "work", "prog.py", [[1], []], []),
        line(after, "work", "prog.py", [[], [[prog, after, 2, 1, 0, None, 0, 1]]], []),
    ])


def test_two_temporary_breakpoints_firing_together_both_leave(tmp_path):
    prog = str(tmp_path / "prog.py")
    at = marked(LOOP, "loop")
    run = traced(tmp_path, LOOP, [[prog, at, 1, 1, None, 0], [prog, at, 1, 1, None, 0],
                                  [prog, at, 1, 0, "i == 3", 0]],
                 record_changed=True, probe=f"core.get_breaks({prog!r}, {at})")
    stops = [list(s) for s in run.stops]
    # First pass: all three count; both temporaries fire and leave; the conditional one is a
    # changed record (hit 1). Passes 2 and 3 only count it; pass 4 stops at it.
    assert len(stops) == 2, stops
    assert stops[0][:4] == list(line(at, "work"))
    deleted, changed = stops[0][4]
    assert sorted(deleted) == [1, 2]
    assert changed == [[prog, at, 3, 1, 0, "i == 3", 0, 1]]
    assert stops[0][5] == [[3, 1, 0, "i == 3", 0, 1]]
    assert stops[1] == list(line(at, "work", "prog.py", [[], [[prog, at, 3, 1, 0, "i == 3", 0, 4]]],
                                 [[3, 1, 0, "i == 3", 0, 4]]))


HANDLED = """
import sys

def check(n):
    seen = []
    for i in range(n):
        x = i  # cond
        seen.append(sys.exc_info()[0])
    try:
        raise KeyError("kept")
    except KeyError:
        y = 1  # in_except
        seen.append(repr(sys.exc_info()[1]))
    return seen

print(check(3))
"""


@pytest.mark.parametrize("cond", ["no_such_name", "1 +", "", "1 / 0", "undefined.attr"])
def test_a_broken_condition_stops_every_time_and_leaves_no_exception(tmp_path, cond):
    prog = str(tmp_path / "prog.py")
    at = marked(HANDLED, "cond")
    inside = marked(HANDLED, "in_except")
    # Temporary and with an ignore count: a broken condition touches neither.
    run = traced(tmp_path, HANDLED, [[prog, at, 1, 1, cond, 5], [prog, inside, 1, 0, cond, 0]],
                 record_changed=True)
    assert run.stdout == "[None, None, None, \"KeyError('kept')\"]\n"
    expected = [line(at, "check", "prog.py", [[], [[prog, at, 1, 1, 1, cond, 5, n]]])
                for n in (1, 2, 3)]
    expected.append(line(inside, "check", "prog.py", [[], [[prog, inside, 2, 1, 0, cond, 0, 1]]]))
    assert_stops(run.stops, expected)


def test_a_false_condition_still_counts_hits(tmp_path):
    prog = str(tmp_path / "prog.py")
    at = marked(LOOP, "loop")
    after = marked(LOOP, "after")
    run = traced(tmp_path, LOOP, [[prog, at, 1, 0, "i < 0", 0], [prog, after, 1, 0, None, 0]],
                 record_changed=True)
    assert_stops(run.stops, [
        line(after, "work", "prog.py", [[], [[prog, after, 2, 1, 0, None, 0, 1],
                                             [prog, at, 1, 1, 0, "i < 0", 0, 4]]]),
    ])


def test_a_true_condition_with_an_ignore_count_ignores_only_true_passes(tmp_path):
    prog = str(tmp_path / "prog.py")
    at = marked(LOOP, "loop")
    run = traced(tmp_path, LOOP.replace("work(4)", "work(8)"),
                 [[prog, at, 1, 0, "i % 2 == 1", 2]], probe="frame.f_locals['i']",
                 after_stop=f"core.get_breaks({prog!r}, {at})")
    # True at i = 1, 3, 5, 7: the first two true passes are ignored.
    assert_stops(run.stops, [line(at, "work", "prog.py", 5), line(at, "work", "prog.py", 7)])
    assert run.after_stop == [[1, 1, 0, "i % 2 == 1", 0, 8]]


LOCALS = """
name = "global"
limit = 10

def scan(values):
    name = "local"
    for v in values:
        doubled = v * 2
        print(v)  # probe
    return name

scan([1, 5, 2, 7])
"""


def test_a_condition_sees_the_current_values_of_local_variables(tmp_path):
    prog = str(tmp_path / "prog.py")
    at = marked(LOCALS, "probe")
    run = traced(tmp_path, LOCALS,
                 [[prog, at, 1, 0, "doubled > 8 and name == 'local' and limit == 10", 0]],
                 probe="frame.f_locals['v']")
    assert_stops(run.stops, [line(at, "scan", "prog.py", 5), line(at, "scan", "prog.py", 7)])


def test_a_condition_does_not_write_back_into_the_frame(tmp_path):
    # A condition may assign through a walrus in its own namespace; the program's variable
    # keeps its value (the locals are not copied back into the frame).
    prog = str(tmp_path / "prog.py")
    source = """
    def f():
        a = 1
        b = 2  # here
        print(a)

    f()
    """
    at = marked(source, "here")
    run = traced(tmp_path, source, [[prog, at, 1, 0, "(a := 5) == 0", 0]])
    assert run.stdout == "1\n"
    assert_stops(run.stops, [])


def test_of_two_breakpoints_on_a_line_only_the_enabled_one_counts(tmp_path):
    prog = str(tmp_path / "prog.py")
    at = marked(LOOP, "loop")
    run = traced(tmp_path, LOOP.replace("work(4)", "work(2)"),
                 [[prog, at, 0, 0, None, 0], [prog, at, 1, 0, None, 0]], record_changed=True,
                 after_stop=f"core.get_breaks({prog!r}, {at})")
    assert_stops(run.stops, [
        line(at, "work", "prog.py", [[], [[prog, at, 2, 1, 0, None, 0, 1]]]),
        line(at, "work", "prog.py", [[], [[prog, at, 2, 1, 0, None, 0, 2]]]),
    ])
    assert run.after_stop == [[2, 1, 0, None, 0, 2], [1, 0, 0, None, 0, 0]]


def test_a_breakpoint_on_a_file_no_module_has_matched_never_stops(tmp_path):
    at = marked(LOOP, "loop")
    other = tmp_path / "elsewhere"
    other.mkdir()
    # Same base name, same text, different file; and a file that does not exist.
    (other / "prog.py").write_text(textwrap.dedent(LOOP).lstrip("\n"))
    run = traced(tmp_path, LOOP, [[str(other / "prog.py"), at, 1, 0, None, 0],
                                  [str(tmp_path / "missing.py"), at, 1, 0, None, 0],
                                  ["prog", at, 1, 0, None, 0]],
                 after_stop=f"[core.get_breaks(f, {at}) for f in "
                            f"({str(other / 'prog.py')!r}, {str(tmp_path / 'missing.py')!r})]")
    assert_stops(run.stops, [])
    assert run.after_stop == [[[1, 1, 0, None, 0, 0]], [[2, 1, 0, None, 0, 0]]]


def test_a_breakpoint_on_a_leading_part_of_the_file_name_hits_it(tmp_path):
    # File identity starts with a text rule: a name that the module's file name begins with
    # stands for that file.
    at = marked(LOOP, "loop")
    run = traced(tmp_path, LOOP, [[str(tmp_path / "pro"), at, 1, 0, None, 0]],
                 max_stops=1)
    assert_stops(run.stops, [line(at, "work")])


def test_stepping_stops_keep_breakpoint_counters_current(tmp_path):
    # Stepping into every line: the stops are stepping stops, and each pass over the
    # breakpoints' line still counts, uses up the ignore count and fires the temporary one.
    prog = str(tmp_path / "prog.py")
    at = marked(LOOP, "loop")
    run = traced(tmp_path, LOOP, [[prog, at, 1, 0, None, 3], [prog, at, 1, 1, None, 0]],
                 first="step_into", default="step_into", when_elsewhere="step_into",
                 record_changed=True,
                 after_stop=f"core.get_breaks({prog!r}, {at})")
    at_line = [s for s in run.stops if s[0] == "line" and s[2] == at]
    assert len(at_line) == 4
    assert at_line[0][4] == [[2], [[prog, at, 1, 1, 0, None, 2, 1]]]
    assert at_line[1][4] == [[], [[prog, at, 1, 1, 0, None, 1, 2]]]
    assert run.after_stop == [[1, 1, 0, None, 0, 4]]


FIRST_LINE = """
x = 1  # first
y = x + 1
print(y)  # last
"""


@pytest.mark.parametrize("spelling", ["absolute", "relative", "dotted"])
def test_continue_run_from_the_start_hits_the_first_line_of_the_program(tmp_path, spelling):
    name = {"absolute": str(tmp_path / "prog.py"), "relative": "prog.py",
            "dotted": "./prog.py"}[spelling]
    first = marked(FIRST_LINE, "first")
    last = marked(FIRST_LINE, "last")
    run = traced(tmp_path, FIRST_LINE, [[name, first, 1, 0, None, 0],
                                        [name, last, 1, 0, None, 0]])
    assert_stops(run.stops, [line(first), line(last)])


MOD = """
value = 10  # modlevel

def f(n):
    doubled = n * 2  # inf
    return doubled
"""


def _import_program(path_expr):
    return f"""
    import os, sys
    sys.path.insert(0, {path_expr})
    import mod
    print(mod.f(1))
    print(mod.f(2))
    """


def _layout(tmp_path):
    """mods/mod.py, a folder `sub`, a symbolic link `link` to mods, and a hard link
    alias.py to mods/mod.py."""
    (tmp_path / "mods").mkdir()
    (tmp_path / "mods" / "mod.py").write_text(textwrap.dedent(MOD).lstrip("\n"))
    (tmp_path / "sub").mkdir()
    os.symlink(str(tmp_path / "mods"), str(tmp_path / "link"))
    os.link(str(tmp_path / "mods" / "mod.py"), str(tmp_path / "alias.py"))


SPELLINGS = {
    "absolute": lambda t: str(t / "mods" / "mod.py"),
    "relative": lambda t: "mods/mod.py",
    "dot-relative": lambda t: "./mods/mod.py",
    "dotdot-relative": lambda t: "sub/../mods/mod.py",
    "dotdot-absolute": lambda t: str(t / "sub") + "/../mods/mod.py",
    "double-slash": lambda t: str(t) + "//mods//mod.py",
    "symlinked-folder": lambda t: str(t / "link" / "mod.py"),
    "symlinked-folder-relative": lambda t: "link/mod.py",
    "hard-link": lambda t: str(t / "alias.py"),
    "hard-link-relative": lambda t: "alias.py",
}


@pytest.mark.parametrize("spelling", sorted(SPELLINGS))
@pytest.mark.parametrize("imported_through", ["mods", "link"])
def test_a_breakpoint_set_before_the_import_hits_by_any_spelling(tmp_path, spelling,
                                                                   imported_through):
    _layout(tmp_path)
    name = SPELLINGS[spelling](tmp_path)
    at = marked(MOD, "inf")
    program = _import_program(f"os.path.join(os.path.dirname(__file__), {imported_through!r})")
    run = traced(tmp_path, program, [[name, at, 1, 0, None, 0]], files=["mod.py"],
                 probe="frame.f_locals['n']", after_stop=f"core.get_breaks({name!r}, {at})")
    assert run.stdout == "2\n4\n"
    assert_stops(run.stops, [line(at, "f", "mod.py", 1), line(at, "f", "mod.py", 2)])
    assert run.after_stop == [[1, 1, 0, None, 0, 2]]


@pytest.mark.parametrize("spelling", sorted(SPELLINGS))
def test_a_breakpoint_set_after_the_import_hits_by_any_spelling(tmp_path, spelling):
    # The breakpoint is set from inside a stop in the program, after `import mod` ran.
    _layout(tmp_path)
    name = SPELLINGS[spelling](tmp_path)
    at = marked(MOD, "inf")
    program = """
    import os, sys
    sys.path.insert(0, os.path.join(os.path.dirname(__file__), "mods"))
    import mod
    print("imported")  # set_here
    print(mod.f(1))
    """
    here = marked(program, "set_here")
    prog = str(tmp_path / "prog.py")
    run = traced(tmp_path, program, [[prog, here, 1, 0, None, 0]], files=["prog.py", "mod.py"],
                 commands=[["exec", f"core.set_break({name!r}, {at}, 1, 0, None, 0)"]])
    assert_stops(run.stops, [line(here), line(at, "f", "mod.py")])


def test_a_breakpoint_set_before_tracing_on_a_module_loaded_before_tracing(tmp_path):
    # The module is loaded before tracing starts: the scan of loaded modules registers it.
    _layout(tmp_path)
    at = marked(MOD, "inf")
    prelude = ("import os, sys; sys.path.insert(0, os.path.abspath('mods')); import mod; "
               f"core.set_break('alias.py', {at}, 1, 0, None, 0)")
    program = ("import os, sys\nsys.path.insert(0, os.path.abspath('mods'))\n"
               "import mod\nprint(mod.f(3))\n")
    run = traced(tmp_path, program, [], files=["mod.py"], prelude=prelude)
    assert_stops(run.stops, [line(at, "f", "mod.py")])


def _dprintf_mask_prelude(mask):
    return ("import ctypes; ctypes.c_uint.in_dll(ctypes.CDLL(core.__file__), "
            f"'gDPrintfMask').value = {mask}")


def test_a_relative_breakpoint_learns_its_module_file_at_the_import(tmp_path):
    _layout(tmp_path)
    at = marked(MOD, "inf")
    log = tmp_path / "debug.txt"
    program = _import_program("os.path.join(os.path.dirname(__file__), 'mods')")
    # Channel 8 (breakpoint file names) on, so that the table's work can be followed.
    run = traced(tmp_path, program, [["mods/mod.py", at, 1, 0, None, 0]], files=["mod.py"],
                 prelude=_dprintf_mask_prelude(8 | 4), debug_file=str(log))
    assert_stops(run.stops, [line(at, "f", "mod.py"), line(at, "f", "mod.py")])
    text = log.read_text()
    set_at = text.index("FINDING BP FILENAME SYNONYMS\n")
    # No module for it yet when it was set ...
    assert text.index("No loaded module for the bp... exiting find_bp_filename_synonyms\n",
                      set_at) < text.index("INITIAL MODULE SCAN")
    # ... and when the module is registered, the relative name becomes a key of the table.
    registered = text.index(f"__tracer_resolve_bp_filenames(module_filename = "
                            f"{tmp_path}/mods/mod.py)\n")
    assert text.index("Found synonym mods/mod.py\n", registered) < text.index("Done resolving\n",
                                                                             registered)


def test_a_module_imported_from_a_compiled_file_is_registered_under_its_source_name(tmp_path):
    # A module that exists only as mods/mod.pyc: its file is registered as mods/mod.py, which
    # a breakpoint on the relative source name finds through the compiled file beside it.
    import py_compile
    _layout(tmp_path)
    source = tmp_path / "mods" / "mod.py"
    py_compile.compile(str(source), cfile=str(tmp_path / "mods" / "mod.pyc"), doraise=True)
    os.unlink(str(tmp_path / "alias.py"))
    source.unlink()
    at = marked(MOD, "inf")
    program = _import_program("os.path.join(os.path.dirname(__file__), 'mods')")
    run = traced(tmp_path, program, [["mods/mod.py", at, 1, 0, None, 0]], files=["mod.py"],
                 probe="frame.f_globals['__file__'].endswith('mod.pyc')")
    assert_stops(run.stops, [line(at, "f", "mod.py", True), line(at, "f", "mod.py", True)])


UNIQUE = re.compile(r"^(\d+) UNIQUE IMPORTS WERE MADE$", re.M)


def test_a_second_name_for_a_registered_file_is_a_synonym_not_a_new_module(tmp_path):
    # mod2.py is a symbolic link to mods/mod.py: importing it registers the same file under
    # another name, which must not count as a new module; mod3.py, a copy, must.
    _layout(tmp_path)
    os.symlink(str(tmp_path / "mods" / "mod.py"), str(tmp_path / "mod2.py"))
    (tmp_path / "mod3.py").write_text(textwrap.dedent(MOD).lstrip("\n"))
    program = """
    import os, sys
    sys.path.insert(0, os.path.join(os.path.dirname(__file__), "mods"))
    import mod
    with open(os.path.join(os.path.dirname(__file__), "extra.txt")) as f:
        extra = f.read()
    if extra:
        __import__(extra)
    """
    counts = {}
    for extra in (None, "mod2", "mod3"):
        log = tmp_path / f"debug-{extra}.txt"
        (tmp_path / "extra.txt").write_text(extra or "")
        ok(traced(tmp_path, program, [], debug_file=str(log)))
        counts[extra] = [int(n) for n in UNIQUE.findall(log.read_text())]
        assert len(counts[extra]) == 1, counts
    assert counts["mod2"] == counts[None]
    assert counts["mod3"] == [counts[None][0] + 1]


def test_a_breakpoint_on_a_synonym_hits_the_module_registered_first(tmp_path):
    _layout(tmp_path)
    os.symlink(str(tmp_path / "mods" / "mod.py"), str(tmp_path / "mod2.py"))
    at = marked(MOD, "inf")
    program = """
    import os, sys
    sys.path.insert(0, os.path.join(os.path.dirname(__file__), "mods"))
    import mod
    import mod2
    print(mod.f(1), mod2.f(2))
    """
    run = traced(tmp_path, program, [["mod2.py", at, 1, 0, None, 0]], files=["mod.py", "mod2.py"],
                 probe="frame.f_locals['n']")
    assert_stops(run.stops, [line(at, "f", "mod.py", 1), line(at, "f", "mod2.py", 2)])


RELOADING = """
import importlib, os, sys
sys.path.insert(0, os.path.join(os.path.dirname(__file__), "mods"))
import mod
print(mod.f(1))
importlib.reload(mod)
print(mod.f(2))
"""


def test_breakpoints_in_a_reloaded_module_hit_before_and_after_the_reload(tmp_path):
    _layout(tmp_path)
    inf = marked(MOD, "inf")
    top = marked(MOD, "modlevel")
    mod = str(tmp_path / "mods" / "mod.py")
    run = traced(tmp_path, RELOADING, [[mod, inf, 1, 0, None, 0], [mod, top, 1, 0, None, 0]],
                 files=["mod.py"], after_stop=f"core.get_file_breaks({mod!r})")
    assert_stops(run.stops, [line(top, "<module>", "mod.py"), line(inf, "f", "mod.py"),
                             line(top, "<module>", "mod.py"), line(inf, "f", "mod.py")])
    assert sorted(run.after_stop) == [[top, 2, 1, 0, None, 0, 2], [inf, 1, 1, 0, None, 0, 2]]


def test_a_breakpoint_set_between_two_loads_of_a_module_hits_the_reloaded_code(tmp_path):
    _layout(tmp_path)
    inf = marked(MOD, "inf")
    reload_line = marked(RELOADING.replace("importlib.reload(mod)",
                                           "importlib.reload(mod)  # reload"), "reload")
    prog = str(tmp_path / "prog.py")
    run = traced(tmp_path, RELOADING, [[prog, reload_line, 1, 0, None, 0]],
                 files=["prog.py", "mod.py"],
                 commands=[["exec", f"core.set_break('mods/mod.py', {inf}, 1, 0, None, 0)"]],
                 probe="frame.f_locals.get('n')")
    assert_stops(run.stops, [line(reload_line, "<module>", "prog.py", None),
                             line(inf, "f", "mod.py", 2)])


THREADED = """
import threading

def work(n):
    out = []
    for i in range(n):
        out.append(i)  # inthread
    return out

t = threading.Thread(target=work, args=(2,), name="worker")
t.start()
t.join()
print(work(1))
"""


def test_a_breakpoint_hits_in_a_thread(tmp_path):
    prog = str(tmp_path / "prog.py")
    at = marked(THREADED, "inthread")
    run = traced(tmp_path, THREADED, [[prog, at, 1, 0, None, 0]], record_threads=True,
                 probe="frame.f_locals['i']")
    assert_stops(run.stops, [line(at, "work", "prog.py", "worker", 0),
                             line(at, "work", "prog.py", "worker", 1),
                             line(at, "work", "prog.py", "main", 0)])


CALLED_FROM_C = """
def key(word):
    return len(word)  # key

def shout(word):
    return word.upper()  # shout

print(sorted(["ccc", "a", "bb"], key=key))
print(list(map(shout, ["x", "y"])))
print(max(["q", "rr"], key=key))
"""


def test_a_breakpoint_hits_in_functions_called_from_c(tmp_path):
    prog = str(tmp_path / "prog.py")
    key = marked(CALLED_FROM_C, "key")
    shout = marked(CALLED_FROM_C, "shout")
    run = traced(tmp_path, CALLED_FROM_C, [[prog, key, 1, 0, None, 0],
                                           [prog, shout, 1, 0, None, 0]],
                 probe="frame.f_locals['word']")
    assert_stops(run.stops, [line(key, "key", "prog.py", w) for w in ("ccc", "a", "bb")]
                 + [line(shout, "shout", "prog.py", w) for w in ("x", "y")]
                 + [line(key, "key", "prog.py", w) for w in ("q", "rr")])


BODIES = """
class Shape:
    sides = 4  # classbody
    names = [
        str(n)  # comp
        for n in range(3)
    ]

    def area(self):
        return sum(
            s * s  # gen
            for s in range(self.sides))

squares = {
    k: k * k  # dict
    for k in range(2)
}
print(Shape.names, Shape().area(), squares)
"""


@pytest.mark.parametrize("tag", ["classbody", "comp", "gen", "dict"])
def test_a_breakpoint_hits_in_class_bodies_and_comprehensions(tmp_path, tag):
    # Wherever the interpreter reports a line event on the breakpoint's line, and only there,
    # the program stops: the plain sys.settrace function's record is the judge.
    prog = str(tmp_path / "prog.py")
    at = marked(BODIES, tag)
    run = traced(tmp_path, BODIES, [[prog, at, 1, 0, None, 0]])
    events = record_lines(tmp_path, prog)
    expected = [("line",) + e for e in events if e[0] == "prog.py" and e[1] == at]
    assert expected, "the interpreter reports no line event there"
    assert_stops(run.stops, expected)


def test_the_callbacks_receive_the_changed_lists(tmp_path):
    # A false-condition breakpoint counts hits without stopping; the next stop of any kind
    # hands its record over: an exception stop, then a step_out's return stop.
    prog = str(tmp_path / "prog.py")
    source = """
    def g():
        a = 1  # counted
        b = 2  # stop_g
        c = 3  # counted2
        return a + b + c

    def f():
        try:
            raise ValueError("v")  # raise
        except ValueError:
            pass
        return g()

    print(f())
    """
    counted = marked(source, "counted")
    stop_g = marked(source, "stop_g")
    counted2 = marked(source, "counted2")
    raised = marked(source, "raise")
    run = traced(tmp_path, source, [[prog, counted, 1, 0, "False", 0],
                                    [prog, stop_g, 1, 0, None, 0],
                                    [prog, counted2, 1, 0, "False", 0]],
                 exception_mode=1, record_changed=True,
                 commands=["continue_run", "step_out", "continue_run"])
    assert_stops(run.stops, [
        ("exception", "prog.py", raised, "f", "ValueError", [[], []]),
        line(stop_g, "g", "prog.py", [[], [[prog, stop_g, 2, 1, 0, None, 0, 1],
                                          [prog, counted, 1, 1, 0, "False", 0, 1]]]),
        ("return", "prog.py", marked(source, "counted2") + 1, "g", 6,
         [[], [[prog, counted2, 3, 1, 0, "False", 0, 1]]]),
    ])
