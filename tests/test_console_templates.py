"""End-to-end tests of the console debugger with a sub-language: templang's templates, its
hook given with `--sub-language` (or registered by the program). Driven through a
pseudo-terminal (console_driver): breakpoints in a template file, stepping through template
lines, into the Python they call and out of the template, values of template variables,
exceptions raised by template lines, and bad --sub-language arguments."""

import os
import subprocess
import sys

from console_driver import Session, environment, stop_line, write
from templang.samples import HOOK, ORDER_PAGE as PAGE

HERE = os.path.dirname(os.path.abspath(__file__))


PROGRAM = """
from templang import render

def money(value):
    text = f"{value:.2f}"
    return text

def main():
    items = [("tea", 2, 1.5), ("cake", 1, 3.0)]
    page = render("page.tpl", customer="Ann", items=items, money=money)
    print(page, end="")
    return 0

main()
"""
OUTPUT = "Order for Ann\n- tea: 3.00\n- cake: 3.00\nTotal: 6.00\n"


def env():
    return environment(PYTHONPATH=HERE)  # templang, as an installed package would be


def debug(tmp_path, *args):
    return Session.debug(tmp_path, *args, env=env())


def test_plain_run_output(tmp_path):
    # What the program prints without a debugger: the sessions below must print the same.
    write(tmp_path, "page.tpl", PAGE)
    write(tmp_path, "prog.py", PROGRAM)
    plain = subprocess.run([sys.executable, "prog.py"], cwd=tmp_path, env=env(),
                           capture_output=True, text=True, timeout=30)
    assert (plain.stdout, plain.returncode) == (OUTPUT, 0)


def test_break_in_a_template_step_through_it_and_out_of_it(tmp_path):
    write(tmp_path, "page.tpl", PAGE)
    write(tmp_path, "prog.py", PROGRAM)
    dbg = debug(tmp_path, "--sub-language", HOOK, "prog.py")
    try:
        assert stop_line(dbg.prompt()) == "> prog.py:1 in <module>()"
        assert dbg.do("break page.tpl:4") == "Breakpoint 1 at page.tpl:4\n"
        out = dbg.do("continue")
        assert stop_line(out) == "> page.tpl:4  (breakpoint 1)"
        assert "-> - {{ name }}: {{ money(qty * price) }}" in out
        assert dbg.do("p name, qty * price") == "('tea', 3.0)\n"
        assert dbg.do("p total") == "0\n"
        assert "statements cannot run" in dbg.do("!name = 'x'")
        # The engine's own frames are hidden: the template line's caller is main().
        assert dbg.do("where").splitlines() == [
            "  prog.py:13 in <module>()", "    -> main()",
            "  prog.py:9 in main()",
            '    -> page = render("page.tpl", customer="Ann", items=items, money=money)',
            "> page.tpl:4", "    -> - {{ name }}: {{ money(qty * price) }}"]
        listing = dbg.do("list").splitlines()
        assert listing[0] == "   1     Order for {{ customer }}"
        assert listing[3] == "   4 B-> - {{ name }}: {{ money(qty * price) }}"
        assert len(listing) == 7
        locals_ = dbg.do("locals")
        assert "name = 'tea'" in locals_ and "customer = 'Ann'" in locals_
        assert dbg.do("up").startswith("> prog.py:9 in main()")
        assert dbg.do("p len(items)") == "2\n"  # Python again, in main()
        assert dbg.do("down").startswith("> page.tpl:4")
        # Into the Python function the line calls, out of it, on to the next template line.
        out = dbg.do("step")
        assert stop_line(out) == "> prog.py:4 in money()"
        out = dbg.do("return")
        assert stop_line(out) == "> prog.py:5 in money()"
        assert "<- money() returns '3.00'" in out
        out = dbg.do("step")
        assert stop_line(out) == "> page.tpl:5"
        assert "-> {% set total = total + qty * price %}" in out
        assert stop_line(dbg.do("next")) == "> page.tpl:3"
        assert stop_line(dbg.do("next")).startswith("> page.tpl:4")
        assert dbg.do("p name, total") == "('cake', 3.0)\n"
        # next and return from the return of a function the template called: on to the
        # template's next line, not out of the template.
        assert stop_line(dbg.do("step")) == "> prog.py:4 in money()"
        assert stop_line(dbg.do("next")) == "> prog.py:5 in money()"
        assert "<- money() returns '3.00'" in dbg.do("next")
        assert stop_line(dbg.do("next")) == "> page.tpl:5"
        assert stop_line(dbg.do("next")) == "> page.tpl:3"
        out = dbg.do("next")
        assert stop_line(out) == "> page.tpl:7"
        assert "-> Total: {{ money(total) }}" in out
        assert stop_line(dbg.do("step")) == "> prog.py:4 in money()"
        assert stop_line(dbg.do("return")) == "> prog.py:5 in money()"
        # The return of money() is the template's last line's last call: what comes next is
        # the Python code after render().
        assert stop_line(dbg.do("return")) == "> prog.py:10 in main()"
        assert dbg.do("p page") == repr(OUTPUT) + "\n"
        out, status = dbg.finish("continue")
        assert OUTPUT.replace("\n", "\n") in out.replace("\r", "")
        assert "The program exited with status 0." in out
        assert status == 0
    finally:
        dbg.close()


def test_a_conditional_template_breakpoint_and_the_breakpoint_list(tmp_path):
    write(tmp_path, "page.tpl", PAGE)
    write(tmp_path, "prog.py", PROGRAM)
    dbg = debug(tmp_path, "--sub-language", HOOK, "--break", "page.tpl:5", "prog.py")
    try:
        first = dbg.prompt()
        assert "Breakpoint 1 at page.tpl:5" in first
        assert dbg.do("condition 1 name == 'cake'") == "Breakpoint 1 stops if name == 'cake'\n"
        assert "page.tpl has no line 8" in dbg.do("break page.tpl:8")
        out = dbg.do("c")
        assert stop_line(out) == "> page.tpl:5  (breakpoint 1)"
        assert dbg.do("p name, total") == "('cake', 3.0)\n"
        listing = dbg.do("breakpoints")
        assert "page.tpl:5" in listing and "hit 2 times" in listing
        # Out of the template from one of its lines: back in main(), after render().
        assert stop_line(dbg.do("return")) == "> prog.py:10 in main()"
        out, status = dbg.finish("c")
        assert "Total: 6.00" in out and status == 0
    finally:
        dbg.close()


FAILING = """\
start {{ a }}
ratio {{ a / b }}
"""

FAILING_PROGRAM = """
from templang import render

try:
    render("err.tpl", a=1, b=0)
except ZeroDivisionError:
    print("caught")
print(render("err.tpl", a=1, b=0))
"""


def test_an_exception_of_a_template_line_stops_there_when_unhandled_only(tmp_path):
    write(tmp_path, "err.tpl", FAILING)
    write(tmp_path, "prog.py", FAILING_PROGRAM)
    dbg = debug(tmp_path, "--sub-language", HOOK, "--no-stop-at-start", "prog.py")
    try:
        # The first error is caught by the program: no stop (the exception settings apply
        # to template lines as to Python lines). The second is not.
        out = dbg.prompt()
        assert "caught" in out
        assert stop_line(out) == "> err.tpl:2"
        assert "-> ratio {{ a / b }}" in out
        assert "!! ZeroDivisionError: division by zero" in out
        assert "(not caught: the program ends with it)" in out
        assert dbg.do("p a, b") == "(1, 0)\n"
        out, status = dbg.finish("continue")  # not shown again on its way out
        assert "ZeroDivisionError" in out and "Traceback" in out
        assert "The program exited with status 1." in out
        assert status == 1
    finally:
        dbg.close()


REGISTERING_PROGRAM = """
from templang import render

try:
    import selvane
    from templang.debughook import TemplateHook
except ImportError:
    pass
else:
    selvane.register_sub_language_hook(TemplateHook())

print(render("err.tpl", a=4, b=2), end="")
"""


def test_a_program_can_register_the_hook_itself(tmp_path):
    write(tmp_path, "err.tpl", FAILING)
    write(tmp_path, "prog.py", REGISTERING_PROGRAM)
    plain = subprocess.run([sys.executable, "prog.py"], cwd=tmp_path, env=env(),
                           capture_output=True, text=True, timeout=30)
    assert (plain.stdout, plain.returncode) == ("start 4\nratio 2.0\n", 0)
    dbg = debug(tmp_path, "--break", "err.tpl:2", "--no-stop-at-start", "prog.py")
    try:
        out = dbg.prompt()
        assert stop_line(out) == "> err.tpl:2  (breakpoint 1)"
        assert dbg.do("p a / b") == "2.0\n"
        out, status = dbg.finish("c")
        assert "start 4\nratio 2.0\n" in out and status == 0
    finally:
        dbg.close()


def run_debugger(tmp_path, *args):
    return subprocess.run([sys.executable, "-m", "selvane", *args], cwd=tmp_path, env=env(),
                          capture_output=True, text=True, timeout=30, stdin=subprocess.DEVNULL)


def test_bad_sub_language_arguments_are_refused_before_the_program_runs(tmp_path):
    write(tmp_path, "prog.py", "print('ran')\n")
    cases = {
        "templang.debughook": "expected MODULE:OBJECT",
        "no_such_module_xyz:Hook": "cannot import no_such_module_xyz",
        "templang.debughook:NoSuchHook": "module templang.debughook has no NoSuchHook",
        "templang.engine:render": "templang.engine:render(): TypeError",
        "os:getcwd": "is not a sub-language hook",
        "templang.debughook:CALL": "neither a sub-language hook nor callable",
    }
    for spec, message in cases.items():
        done = run_debugger(tmp_path, "--sub-language", spec, "prog.py")
        assert done.returncode == 2, (spec, done.stderr)
        assert f"python -m selvane: --sub-language {spec}: " in done.stderr, done.stderr
        assert message in done.stderr, (spec, done.stderr)
        assert "ran" not in done.stdout


def test_help_documents_the_option(tmp_path):
    done = run_debugger(tmp_path, "--help")
    assert "--sub-language MODULE:OBJECT" in done.stdout
