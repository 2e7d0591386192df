"""Places that cannot stop while everything runs freely may go quiet (with sys.monitoring they
answer DISABLE and the interpreter stops reporting them). Whatever can make a stop possible
again must bring them back before the program runs on: a breakpoint set while the program
runs, a stepping command, a new tracing session. These programs run first freely through the
code where the stops are expected later; they pass on either event source."""

import subprocess
import sys
import textwrap

from conftest import TIMEOUT, assert_stops, ok, run_traced

SPIN = """
import tvantrel30pydebugstackless as core

def spin(n):
    total = 0
    for i in range(n):
        total += i
    return total

spin(50)                                   # runs freely: every place of spin goes quiet
"""


def test_a_breakpoint_set_while_running_is_hit_in_code_that_ran_freely(tmp_path):
    program = SPIN + "core.set_break(__file__, 6, 1, 0, None, 0)\nspin(3)\n"
    run = ok(run_traced(tmp_path, textwrap.dedent(program), first="continue_run",
                        probe="frame.f_locals['i']"))
    assert_stops(run.stops, [("line", "prog.py", 6, "spin", i) for i in range(3)])


def test_stepping_into_code_that_ran_freely_stops_at_each_of_its_lines(tmp_path):
    program = SPIN + "spin(2)\n"
    prog = tmp_path / "prog.py"
    prog.write_text(program.lstrip("\n"))
    run = ok(run_traced(tmp_path, str(prog), first="continue_run",
                        breaks=[[str(prog), 10, 1, 0, None, 0]], max_stops=8,
                        default="step_into"))
    assert_stops(run.stops, [
        ("line", "prog.py", 10, "<module>"),
        ("line", "prog.py", 4, "spin"),
        ("line", "prog.py", 5, "spin"),
        ("line", "prog.py", 6, "spin"),
        ("line", "prog.py", 5, "spin"),
        ("line", "prog.py", 6, "spin"),
        ("line", "prog.py", 5, "spin"),
        ("line", "prog.py", 7, "spin"),
    ])


def test_step_over_and_step_out_from_a_breakpoint_in_code_that_ran_freely(tmp_path):
    program = SPIN + "spin(2)\nspin(1)\n"
    prog = tmp_path / "prog.py"
    prog.write_text(program.lstrip("\n"))
    run = ok(run_traced(tmp_path, str(prog), first="continue_run",
                        breaks=[[str(prog), 7, 1, 0, None, 0]],
                        commands=["step_over", "step_out", "continue_run"]))
    assert_stops(run.stops, [
        ("line", "prog.py", 7, "spin"),      # spin(50), the breakpoint set before start
        ("return", "prog.py", 7, "spin", 1225),
        ("line", "prog.py", 10, "<module>"),  # step_out: back in the caller, its next line
        ("line", "prog.py", 7, "spin"),      # spin(2), after continue_run
        ("line", "prog.py", 7, "spin"),      # spin(1)
    ])


CYCLES = """
import builtins, sys
import tvantrel30pydebugstackless as core

def spin(n):
    total = 0
    for i in range(n):
        total += i
    return total

hits = []
noop = lambda *a: None
def line_cb(frame, changed):
    hits.append(frame.f_lineno)
    core.continue_run()
core.init(0.0, 0, noop, noop, line_cb, noop, noop, noop, None, builtins.__import__, None, {})
for cycle in range(5):
    core.continue_run()
    core.start_trace()
    spin(20)                              # freely: quiet
    core.stop_trace()
core.set_break(__file__, 8, 1, 0, None, 0)
core.continue_run()
core.start_trace()
spin(3)
core.stop_trace()
print(hits)
"""


def test_places_quiet_in_an_earlier_session_are_reported_in_the_next(tmp_path):
    script = tmp_path / "cycles.py"
    script.write_text(CYCLES)
    out = subprocess.run([sys.executable, str(script)], capture_output=True, text=True,
                         timeout=TIMEOUT)
    assert out.returncode == 0, out.stderr
    assert out.stdout == "[8, 8, 8]\n"


def test_stepping_into_a_function_that_was_stepped_over_stops_inside_it(tmp_path):
    # While the first call is stepped over, the callee's places may go quiet; stepping into
    # the second call must find them reported again.
    program = """
    def f(x):
        y = x + 1
        return y

    for i in range(2):
        f(i)
    print("done")
    """
    run = ok(run_traced(tmp_path, program, first="continue_run",
                        breaks=[[str(tmp_path / "prog.py"), 6, 1, 0, None, 0]],
                        commands=["step_over", "step_over", "step_into"], max_stops=4,
                        probe="frame.f_locals.get('i', frame.f_locals.get('x'))"))
    assert_stops(run.stops, [
        ("line", "prog.py", 6, "<module>", 0),
        ("line", "prog.py", 5, "<module>", 0),
        ("line", "prog.py", 6, "<module>", 1),
        ("line", "prog.py", 2, "f", 1),
    ])
    assert run.stdout == "done\n"


def test_a_line_range_stepped_over_stops_in_the_caller_when_the_frame_returns(tmp_path):
    # Stepping over lines 2-3 of f: f returns inside the range, so the stop comes at the
    # caller's next line, a place that ran freely before.
    program = """
    def f(x):
        y = x + 1
        return y

    f(0)
    f(1)
    print("done")
    """
    prog = str(tmp_path / "prog.py")
    run = ok(run_traced(tmp_path, program, first="continue_run",
                        breaks=[[prog, 2, 1, 0, None, 1]],
                        commands=[["step_over_line_range", 2, 3]], max_stops=2))
    assert_stops(run.stops, [
        ("line", "prog.py", 2, "f"),
        ("line", "prog.py", 7, "<module>"),
    ])
