"""Breakpoint conditions in a traced program: compiled once, evaluated in the frame's globals
and a snapshot of its locals, never written back into the program.

Each test traces a small program under scripted_server.py with continue_run from the start,
so that every stop is a breakpoint stop. Set TRACE_DRY_RUN=1 to print the actual stops.
"""

import pytest

from conftest import assert_stops, run_plain, run_traced
from test_breakpoints import line, marked, traced


COUNTED = """
import sys

compiles = []
sys.addaudithook(lambda event, args: compiles.append(args[1])
                 if event == "compile" and args[1] == "<string>" else None)

def work(n):
    total = 0
    for i in range(n):
        total += i  # loop
    return total

work(50)
print(len(compiles))
"""


@pytest.mark.parametrize("cond", ["i == -1", "i < 0 or total < 0", "undefined_name",
                                  "len(str(i)) > 5"])
def test_a_condition_is_compiled_once_for_all_its_passes(tmp_path, cond):
    prog = str(tmp_path / "prog.py")
    at = marked(COUNTED, "loop")
    run = run_traced(tmp_path, COUNTED, breaks=[[prog, at, 1, 0, cond, 0]],
                     first="continue_run", default="continue_run",
                     when_elsewhere="continue_run")
    assert run_plain(tmp_path, COUNTED).stdout == "0\n"
    # One compile of the condition, however many passes evaluate it (a broken one stops
    # at each of them and is still compiled only once).
    assert run.stdout == "1\n", run.stderr
    stops = 50 if cond == "undefined_name" else 0
    assert len(run.stops) == stops


def test_a_condition_that_changes_its_own_text_is_compiled_again(tmp_path):
    # The first pass runs a condition that replaces itself; the passes after it use the new
    # text, not the code compiled for the old one.
    prog = str(tmp_path / "prog.py")
    source = """
    def work(n):
        total = 0
        for i in range(n):
            total += i  # loop
        return total

    print(work(5))
    """
    at = marked(source, "loop")
    change = (f"__import__('tvantrel30pydebugstackless').set_breaks_cond({prog!r}, {at}, "
              f"'i == 3') and False")
    run = traced(tmp_path, source, [[prog, at, 1, 0, change, 0]], probe="frame.f_locals['i']")
    assert_stops(run.stops, [line(at, "work", "prog.py", 3)])


SCOPES = """
shadowed = "global"
only_global = 7

def outer():
    cell = 11
    def inner(values):
        shadowed = "local"
        for v in values:
            seen = cell + v  # probe
        return seen
    return inner

print(outer()([1, 2, 3]))
"""


@pytest.mark.parametrize("cond,stop_at", [
    ("shadowed == 'local' and v == 2", [2]),
    ("only_global == 7 and v != 2", [1, 3]),
    ("cell == 11 and v == 3", [3]),
    ("len(values) == 3 and v == 1", [1]),
    ("'seen' in locals() and v > 1", [2, 3]),
    ("sorted(vars())[0] == 'cell' and v == 1", [1]),
    ("__import__('sys')._getframe(0).f_locals['v'] == 2", [2]),
    ("any(w == 3 for w in values) and v == 1", [1]),
])
def test_a_condition_reads_locals_cells_globals_and_builtins(tmp_path, cond, stop_at):
    prog = str(tmp_path / "prog.py")
    at = marked(SCOPES, "probe")
    run = traced(tmp_path, SCOPES, [[prog, at, 1, 0, cond, 0]], probe="frame.f_locals['v']")
    assert_stops(run.stops, [line(at, "inner", "prog.py", v) for v in stop_at])


def test_a_condition_at_module_level_binds_nothing_in_the_module(tmp_path):
    prog = str(tmp_path / "prog.py")
    source = """
    a = 1
    b = 2  # here
    print(a, globals().get("fresh", "unbound"))
    """
    at = marked(source, "here")
    run = traced(tmp_path, source, [[prog, at, 1, 0, "(a := 5) == 0 or (fresh := 1) == 0", 0]])
    assert run.stdout == "1 unbound\n"
    assert_stops(run.stops, [])


def test_a_condition_in_a_class_body_reads_the_class_namespace(tmp_path):
    prog = str(tmp_path / "prog.py")
    source = """
    size = "global"
    class K:
        size = 3
        other = 4  # here
    print(K.size)
    """
    at = marked(source, "here")
    run = traced(tmp_path, source, [[prog, at, 1, 0, "size == 3", 0]])
    assert_stops(run.stops, [line(at, "K", "prog.py")])
