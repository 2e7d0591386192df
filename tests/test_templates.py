"""Expected-sequence tests of debugging templates: the tests' template language (templang)
with its hook registered, traced in a subprocess under scripted_server.py.

A stop at a template line (a key frame, one call of templang's `_execute`) is recorded at
the hook's translation: ("line", "page.tpl", 4, "_execute"). A stop anywhere else in the
template engine would be recorded with "impl" in place of the line, whatever the test
records otherwise, so that a stop inside the implementation cannot go unseen. Python stops
are as in test_stepping.py. Every traced run must print what an untraced run prints.

How the expectations are made: the hook answers "stop" at the entry of a template line when
stepping into or over template lines and when a breakpoint asks, so step_into stops once per
template line run (loop lines once per pass) and at the Python lines of the functions the
template calls; step_over stops at the next template line; step_out of a template line stops
in the Python code that called render(). Template breakpoints are set by the template's
absolute path, which the hook's translation gives byte for byte. Set TRACE_DRY_RUN=1 to print
the actual lists.
"""

import os
import subprocess
import sys
import textwrap

import pytest

from conftest import HERE, TIMEOUT, assert_stops, run_traced, write_program
from templang.samples import HOOK, ORDER_PAGE as PAGE


PROGRAM = """
from templang import render

def money(value):
    text = f"{value:.2f}"
    return text

def main():
    items = [("tea", 2, 1.5), ("cake", 1, 3.0), ("jam", 3, 2.0)]
    page = render("page.tpl", customer="Ann", items=items, money=money)
    print(page, end="")
    return len(page)

main()
"""
RENDER_LINE = 9  # `page = render(...)` in main()


def line(number, function="<module>", file="prog.py"):
    return ("line", file, number, function)


def ret(number, function, value, file="prog.py"):
    return ("return", file, number, function, value)


def tpl(number, file="page.tpl"):
    return ("line", file, number, "_execute")


def trace(tmp_path, program=PROGRAM, templates=None, **config):
    """Traces `program` with the templates ({name: text}, default page.tpl) next to it and
    the hook registered; checks that output and exit status are those of an untraced run."""
    for name, text in (templates or {"page.tpl": PAGE}).items():
        (tmp_path / name).write_text(text)
    path = write_program(tmp_path, program)
    config.setdefault("sub_languages", [HOOK])
    config.setdefault("files", ["prog.py"] + list(templates or {"page.tpl": PAGE}))
    run = run_traced(tmp_path, path, timeout=60, **config)
    plain = run_plain(tmp_path, path)
    assert run.stdout == plain.stdout, run.stderr
    assert run.returncode == plain.returncode, run.stderr
    return run


def run_plain(tmp_path, program):
    """The program run without any debugger, templang importable as under the server."""
    env = dict(os.environ, PYTHONPATH=HERE)
    return subprocess.run([sys.executable, program], capture_output=True, text=True,
                          timeout=TIMEOUT, cwd=str(tmp_path), env=env)


def template_break(tmp_path, number, name="page.tpl", cond=None, ignore=0, temporary=0):
    return [str(tmp_path / name), number, 1, temporary, cond, ignore]


def python_break(tmp_path, number):
    return [str(tmp_path / "prog.py"), number, 1, 0, None, 0]


# ---- breakpoints in templates ----------------------------------------------------------


def test_a_template_breakpoint_stops_at_its_line_once_per_pass(tmp_path):
    run = trace(tmp_path, first="continue_run", breaks=[template_break(tmp_path, 4)],
                probe="server.hooks[0]._Eval('name', frame)",
                after_stop=f"core.get_breaks({str(tmp_path / 'page.tpl')!r}, 4)")
    assert run.stdout.startswith("Order for Ann\n- tea: 3.00\n")
    assert_stops(run.stops, [tpl(4) + ("tea",), tpl(4) + ("cake",), tpl(4) + ("jam",)])
    assert run.after_stop == [[run.break_ids[0], 1, 0, None, 0, 3]]  # three hits


def test_a_template_breakpoint_with_an_ignore_count(tmp_path):
    run = trace(tmp_path, first="continue_run", breaks=[template_break(tmp_path, 4, ignore=2)],
                probe="server.hooks[0]._Eval('name', frame)",
                after_stop=f"core.get_breaks({str(tmp_path / 'page.tpl')!r}, 4)")
    assert_stops(run.stops, [tpl(4) + ("jam",)])
    assert run.after_stop == [[run.break_ids[0], 1, 0, None, 0, 3]]


def test_a_line_outside_the_loop_and_a_line_not_run(tmp_path):
    # Line 6 ({% end %}) is no line that runs: its breakpoint never stops.
    run = trace(tmp_path, first="continue_run",
                breaks=[template_break(tmp_path, 7), template_break(tmp_path, 6),
                        template_break(tmp_path, 1)])
    assert_stops(run.stops, [tpl(1), tpl(7)])


def test_a_template_breakpoint_is_matched_by_the_template_s_absolute_path_only(tmp_path):
    # The core compares sub-language file names as given: a relative name never matches.
    run = trace(tmp_path, first="continue_run",
                breaks=[["page.tpl", 4, 1, 0, None, 0], template_break(tmp_path, 2)])
    assert_stops(run.stops, [tpl(2)])


@pytest.mark.parametrize("condition, names", [
    ("name == 'cake'", ["cake"]),
    ("qty * price > 2.5", ["tea", "cake", "jam"]),
    ("price > 100", []),
    ("total >= 3", ["cake", "jam"]),         # a variable the template set itself
    ("no_such_variable > 1", ["tea", "cake", "jam"]),  # a broken condition stops
    ("1 +", ["tea", "cake", "jam"]),
])
def test_a_template_breakpoint_condition_is_evaluated_in_the_template_s_variables(
        tmp_path, condition, names):
    run = trace(tmp_path, first="continue_run",
                breaks=[template_break(tmp_path, 4, cond=condition)],
                probe="server.hooks[0]._Eval('name', frame)",
                after_stop=f"core.get_breaks({str(tmp_path / 'page.tpl')!r}, 4)[0][5]")
    assert_stops(run.stops, [tpl(4) + (name,) for name in names])
    assert run.after_stop == 3  # every pass counts a hit, whatever the condition says


def test_a_temporary_template_breakpoint_stops_once(tmp_path):
    run = trace(tmp_path, first="continue_run",
                breaks=[template_break(tmp_path, 4, temporary=1)],
                after_stop=f"core.get_breaks({str(tmp_path / 'page.tpl')!r}, 4)")
    assert_stops(run.stops, [tpl(4)])
    assert run.after_stop == []


# ---- stepping through templates ---------------------------------------------------------

ONE_PASS = """
from templang import render

def money(value):
    text = f"{value:.2f}"
    return text

def main():
    items = [("tea", 2, 1.5)]
    page = render("page.tpl", customer="Ann", items=items, money=money)
    print(page, end="")
    return len(page)

main()
"""


def test_step_into_stops_at_every_template_line_run_and_in_the_python_it_calls(tmp_path):
    run = trace(tmp_path, ONE_PASS, first="continue_run",
                breaks=[python_break(tmp_path, RENDER_LINE)], default="step_into",
                max_stops=40)
    assert_stops(run.stops, [
        line(9, "main"),
        tpl(1), tpl(2), tpl(3),
        tpl(4), line(4, "money"), line(5, "money"), ret(5, "money", "3.00"),
        tpl(5),
        tpl(3),  # the loop line again: no more items
        tpl(7), line(4, "money"), line(5, "money"), ret(5, "money", "3.00"),
        line(10, "main"), line(11, "main"), ret(11, "main", 38),
        ret(13, "<module>", None),
    ])


def test_step_over_goes_from_template_line_to_template_line(tmp_path):
    run = trace(tmp_path, first="continue_run", breaks=[template_break(tmp_path, 2)],
                default="step_over", max_stops=40)
    assert_stops(run.stops, [
        tpl(2), tpl(3),
        tpl(4), tpl(5), tpl(3), tpl(4), tpl(5), tpl(3), tpl(4), tpl(5), tpl(3),
        tpl(7),
        # After the last template line: the caller of render(), as when a Python function
        # stepped over returns.
        line(10, "main"), line(11, "main"), ret(11, "main", 64),
        ret(13, "<module>", None),
    ])


def test_step_over_from_python_over_render_enters_no_template(tmp_path):
    run = trace(tmp_path, first="continue_run", breaks=[python_break(tmp_path, 8)],
                default="step_over")
    assert_stops(run.stops, [
        line(8, "main"), line(9, "main"), line(10, "main"), line(11, "main"),
        ret(11, "main", 64), ret(13, "<module>", None),
    ])


def test_step_out_of_a_template_line_stops_in_the_caller_of_render(tmp_path):
    run = trace(tmp_path, first="continue_run",
                breaks=[template_break(tmp_path, 4, temporary=1)],
                commands=["step_out"], default="step_into", max_stops=4)
    assert_stops(run.stops, [
        tpl(4),
        line(10, "main"), line(11, "main"), ret(11, "main", 64),
    ])


def test_breakpoints_still_stop_during_a_step_out(tmp_path):
    run = trace(tmp_path, first="continue_run", breaks=[template_break(tmp_path, 4)],
                default="step_out", max_stops=6)
    assert_stops(run.stops, [
        tpl(4), tpl(4), tpl(4),  # each step_out is cut short by the next pass's breakpoint
        line(10, "main"), ret(11, "main", 64), ret(13, "<module>", None),
    ])


def test_step_out_of_a_python_function_called_by_a_template_then_on_into_the_template(
        tmp_path):
    run = trace(tmp_path, ONE_PASS, first="continue_run",
                breaks=[template_break(tmp_path, 4, temporary=1)],
                commands=["step_into", "step_out", "step_into", "step_into"],
                default="continue_run")
    assert_stops(run.stops, [
        tpl(4), line(4, "money"),
        ret(5, "money", "3.00"),   # step_out of money: its return
        tpl(5),                    # step_into: the next template line
        tpl(3),
    ])


def test_step_into_from_python_enters_the_first_template_line(tmp_path):
    run = trace(tmp_path, first="continue_run", breaks=[python_break(tmp_path, RENDER_LINE)],
                commands=["step_into", "step_over", "step_out"], max_stops=5,
                default="step_into")
    assert_stops(run.stops, [
        line(9, "main"), tpl(1), tpl(2), line(10, "main"), line(11, "main"),
    ])


# ---- exceptions raised by template lines -------------------------------------------------

FAILING = """\
start {{ a }}
ratio {{ a / b }}
never {{ a }}
"""

FAILING_PROGRAM = """
from templang import render

def page(a, b):
    return render("err.tpl", a=a, b=b)

print(page(1, 2), end="")
page(1, 0)
"""


@pytest.mark.parametrize("mode", [1, 2])
def test_an_exception_of_a_template_line_is_reported_at_that_line(tmp_path, mode):
    run = trace(tmp_path, FAILING_PROGRAM, templates={"err.tpl": FAILING},
                first="continue_run", exception_mode=mode, when_elsewhere="continue_run",
                probe="frame.f_code.co_name")
    assert "ZeroDivisionError" in run.stderr
    expected = [
        ("exception", "err.tpl", 2, "_execute", "ZeroDivisionError", "_execute"),
        # The core reports the template line's exception again in each frame of the engine
        # it passes through (the hook is asked about the innermost frame, the template
        # line); a server side hides these frames (selvane passes them through).
        ("exception", "engine.py", "impl", "_run_block", "ZeroDivisionError", "_run_block"),
        ("exception", "engine.py", "impl", "render", "ZeroDivisionError", "render"),
        ("exception", "prog.py", 4, "page", "ZeroDivisionError", "page"),
        ("exception", "prog.py", 7, "<module>", "ZeroDivisionError", "<module>"),
    ]
    if mode == 2:
        # The stop at the template line is the sub-language's own; the first frame that
        # finds the exception unhandled stops once, and the outer frames no more.
        expected = expected[:2]
    assert_stops(run.stops, expected)


CAUGHT_PROGRAM = """
from templang import render

try:
    render("err.tpl", a=1, b=0)
except ZeroDivisionError:
    print("caught")
"""


@pytest.mark.parametrize("mode", [0, 2])
def test_a_caught_template_exception_stops_the_core_running_freely_in_any_mode(tmp_path,
                                                                                mode):
    # The core asks the hook about an exception of a key frame twice, with the same
    # arguments when the program runs freely: once whether to stop (where a true answer
    # stops whatever the exception mode says) and once whether to report a stop decided by
    # the exception settings. A hook that reports its template lines' exceptions therefore
    # stops at every one of them; selvane applies the exception settings to such stops
    # itself (test_console_templates.py).
    run = trace(tmp_path, CAUGHT_PROGRAM, templates={"err.tpl": FAILING},
                first="continue_run", exception_mode=mode, when_elsewhere="continue_run")
    assert run.stdout == "caught\n"
    assert_stops(run.stops, [("exception", "err.tpl", 2, "_execute", "ZeroDivisionError")])


def test_stepping_into_a_failing_template_line_stops_at_its_exception(tmp_path):
    run = trace(tmp_path, FAILING_PROGRAM, templates={"err.tpl": FAILING},
                first="continue_run", breaks=[python_break(tmp_path, 7)],
                exception_mode=0, default="step_into", max_stops=6)
    assert_stops(run.stops, [
        line(7), line(4, "page"),
        ("line", "err.tpl", 1, "_execute"), ("line", "err.tpl", 2, "_execute"),
        ("exception", "err.tpl", 2, "_execute", "ZeroDivisionError"),
        ("exception", "prog.py", 4, "page", "ZeroDivisionError"),
    ])


def test_an_exception_of_a_python_function_called_by_a_template_is_reported_there(tmp_path):
    program = """
    from templang import render

    def check(value):
        if value < 0:
            raise ValueError(value)
        return value

    render("{{ check(1) }}\\n{{ check(-1) }}\\n", check=check)
    """
    run = trace(tmp_path, program, templates={}, first="continue_run", exception_mode=2,
                max_stops=1)
    assert_stops(run.stops, [("exception", "prog.py", 5, "check", "ValueError")])


# ---- the engine never shows, whatever runs ------------------------------------------------


def test_stop_inside_the_template_engine_is_never_made(tmp_path):
    # `stop` stops at the next event anywhere: inside the engine that is the next template
    # line, not the engine's own code.
    run = trace(tmp_path, ONE_PASS, first="continue_run",
                breaks=[python_break(tmp_path, RENDER_LINE)],
                commands=["stop", "stop", "stop"], max_stops=4)
    assert_stops(run.stops, [line(9, "main"), tpl(1), tpl(2), tpl(3)])


def test_frame_categories_and_the_active_hook_at_stops(tmp_path):
    probe = ("(core.sub_language_get_frame_category(core.get_current_tstate_id(), frame), "
             "core.sub_language_get_active_hook(core.get_current_tstate_id()) is "
             "server.hooks[0], "
             "core.sub_language_get_frame_category(core.get_current_tstate_id(), "
             "frame.f_back))")
    run = trace(tmp_path, ONE_PASS, first="continue_run",
                breaks=[python_break(tmp_path, RENDER_LINE), template_break(tmp_path, 4),
                        python_break(tmp_path, 5), python_break(tmp_path, 10)],
                probe=probe)
    assert_stops(run.stops, [
        line(9, "main") + ([-1, False, -1],),
        tpl(4) + ([1, True, 0],),            # a key frame, called by the engine's loop
        line(5, "money") + ([-1, True, 1],),  # a Python function, called by the key frame
        line(5, "money") + ([-1, True, 1],),
        line(10, "main") + ([-1, False, -1],),  # render() has returned: no active hook
    ])


# ---- templates and the rest of the program ----------------------------------------------


def test_a_template_rendered_while_the_program_stands_at_a_python_breakpoint(tmp_path):
    # At a Python breakpoint the server side renders a template itself (as `p render(...)`
    # would): that runs untraced, takes no stop at the template's breakpoint and leaves no
    # active hook behind; the program's own render then stops there as usual.
    render_at_stop = ("shared.rendered = __import__('templang').render("
                      "'page.tpl', customer='Bo', items=[('x', 1, 1.0)], money=str)")
    run = trace(tmp_path, first="continue_run",
                breaks=[python_break(tmp_path, 8), template_break(tmp_path, 7)],
                commands=[["exec", render_at_stop]],
                probe="core.sub_language_get_active_hook(core.get_current_tstate_id()) "
                      "is not None",
                after_stop="shared.rendered")
    assert_stops(run.stops, [line(8, "main") + (False,), tpl(7) + (True,)])
    assert run.after_stop == "Order for Bo\n- x: 1.0\nTotal: 1.0\n"


THREADS = """
import threading
from templang import render

def money(value):
    return f"{value:.2f}"

def pages():
    for n in range(3):
        render("page.tpl", customer=f"c{n}", items=[("tea", n, 1.0)], money=money)

def plain():
    total = 0
    for n in range(3):
        total += n  # plain
    return total

worker = threading.Thread(target=pages, name="templates")
worker.start()
print(plain())
worker.join()
print("done")
"""


def test_a_thread_rendering_templates_while_another_runs_plain_python(tmp_path):
    plain_line = textwrap.dedent(THREADS).lstrip("\n").splitlines().index(
        "        total += n  # plain") + 1
    run = trace(tmp_path, THREADS, first="continue_run",
                breaks=[template_break(tmp_path, 4), template_break(tmp_path, 1),
                        python_break(tmp_path, plain_line)],
                record_threads=True, max_stops=50,
                probe="(server.hooks[0]._Eval('customer', frame) "
                      "if core.sub_language_get_frame_category("
                      "core.get_current_tstate_id(), frame) == 1 else frame.f_locals['n'])")
    assert run.stdout == "3\ndone\n"
    by_thread = {}
    for stop in run.stops:
        by_thread.setdefault(stop[-2], []).append(stop[:-2] + (stop[-1],))
    assert set(by_thread) == {"main", "templates"}
    assert by_thread["main"] == [line(plain_line, "plain") + (n,) for n in range(3)]
    assert by_thread["templates"] == [
        tpl(1) + ("c0",), tpl(4) + ("c0",), tpl(1) + ("c1",), tpl(4) + ("c1",),
        tpl(1) + ("c2",), tpl(4) + ("c2",),
    ]
