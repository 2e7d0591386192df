"""End-to-end tests of the console debugger (`python -m selvane`): breakpoints, stepping,
values, editing locals, jumping, -m module, and the program's own input, output and exit
status. Each drives the debugger through a pseudo-terminal (console_driver)."""

import subprocess
import sys

import pytest

from console_driver import Session, environment, stop_line, write

SUM_PROGRAM = """
import sys


def add(a, b):
    total = a + b
    return total


def main():
    s = 0
    for v in [1, 2, 3, 4]:
        s = add(s, v)
    print("sum", s)
    return s


if __name__ == "__main__":
    sys.exit(main())
"""


@pytest.fixture
def sum_program(tmp_path):
    return write(tmp_path, "prog.py", SUM_PROGRAM)


def test_breakpoint_session(tmp_path, sum_program):
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        first = dbg.prompt()
        assert stop_line(first) == "> prog.py:1 in <module>()"
        assert "-> import sys" in first
        assert dbg.do("break 5") == "Breakpoint 1 at prog.py:5\n"
        out = dbg.do("continue")
        assert stop_line(out) == "> prog.py:5 in add()  (breakpoint 1)"
        assert "-> total = a + b" in out
        assert dbg.do("p a, b") == "(0, 1)\n"
        where = dbg.do("where").splitlines()
        assert where == ["  prog.py:18 in <module>()", "    -> sys.exit(main())",
                         "  prog.py:12 in main()", "    -> s = add(s, v)",
                         "> prog.py:5 in add()", "    -> total = a + b"]
        out = dbg.do("c")
        assert stop_line(out) == "> prog.py:5 in add()  (breakpoint 1)"
        assert dbg.do("p a, b") == "(1, 2)\n"
        listing = dbg.do("breakpoints")
        assert "1    keep  yes      prog.py:5" in listing
        assert "hit 2 times" in listing
        assert dbg.do("up").startswith("> prog.py:12 in main()")
        assert dbg.do("p s") == "1\n"
        assert dbg.do("down").startswith("> prog.py:5 in add()")
        assert dbg.do("clear 1") == "Deleted breakpoint 1 at prog.py:5\n"
        assert dbg.do("breakpoints") == "No breakpoints.\n"
        out, status = dbg.finish("continue")
        assert "sum 10" in out
        assert "The program exited with status 10." in out
        assert status == 10
    finally:
        dbg.close()


def test_stepping_in_and_out(tmp_path, sum_program):
    dbg = Session.debug(tmp_path, "--break", "prog.py:12", "prog.py")
    try:
        dbg.prompt()
        assert stop_line(dbg.do("c")) == "> prog.py:12 in main()  (breakpoint 1)"
        assert dbg.do("clear 1").startswith("Deleted")
        assert stop_line(dbg.do("step")) == "> prog.py:5 in add()"
        assert stop_line(dbg.do("s")) == "> prog.py:6 in add()"
        out = dbg.do("n")
        assert stop_line(out) == "> prog.py:6 in add()"
        assert "<- add() returns 1" in out
        assert stop_line(dbg.do("next")) == "> prog.py:11 in main()"
        assert stop_line(dbg.do("n")) == "> prog.py:12 in main()"
        assert stop_line(dbg.do("step")) == "> prog.py:5 in add()"
        out = dbg.do("return")
        assert stop_line(out) == "> prog.py:6 in add()"
        assert "<- add() returns 3" in out
        # until: past the loop to the first line after it.
        assert stop_line(dbg.do("n")) == "> prog.py:11 in main()"
        assert stop_line(dbg.do("until 13")) == "> prog.py:13 in main()"
        assert dbg.do("p s") == "10\n"
        out, status = dbg.finish("c")
        assert status == 10
    finally:
        dbg.close()


def test_condition_and_ignore_count(tmp_path, sum_program):
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        dbg.prompt()
        assert dbg.do("break 5, b >= 3") == "Breakpoint 1 at prog.py:5 if b >= 3\n"
        assert dbg.do("c").startswith("> prog.py:5 in add()  (breakpoint 1)")
        assert dbg.do("p b") == "3\n"
        assert dbg.do("condition 1") == "Breakpoint 1 is now unconditional\n"
        assert dbg.do("break 12") == "Breakpoint 2 at prog.py:12\n"
        assert dbg.do("ignore 2 1") == "Breakpoint 2 will be passed 1 more time\n"
        assert dbg.do("disable 1") == "Disabled breakpoint 1\n"
        # Line 12 runs for v=4 once more: that pass is ignored, and the loop ends.
        out, status = dbg.finish("c")
        assert "sum 10" in out and status == 10
    finally:
        dbg.close()


def test_ignore_count_passes_then_stops(tmp_path, sum_program):
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        dbg.prompt()
        dbg.do("break 5")
        assert dbg.do("ignore 1 2") == "Breakpoint 1 will be passed 2 more times\n"
        assert dbg.do("c").startswith("> prog.py:5 in add()  (breakpoint 1)")
        assert dbg.do("p b") == "3\n"
        listing = dbg.do("breakpoints")
        assert "hit 3 times" in listing and "ignore next" not in listing
        dbg.do("condition 1 b == 4")
        assert dbg.do("c").startswith("> prog.py:5 in add()  (breakpoint 1)")
        assert dbg.do("p b") == "4\n"
        assert "hit 4 times" in dbg.do("breakpoints")
        out, status = dbg.finish("c")
        assert status == 10
    finally:
        dbg.close()


def test_temporary_breakpoint_and_function_name(tmp_path, sum_program):
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        dbg.prompt()
        assert dbg.do("n") .startswith("> prog.py:4")
        assert dbg.do("n").startswith("> prog.py:9")
        assert dbg.do("tbreak add") == "Temporary breakpoint 1 at prog.py:5\n"
        out = dbg.do("c")
        assert stop_line(out) == "> prog.py:5 in add()  (breakpoint 1)"
        assert "(temporary breakpoint 1 deleted)" in out
        assert dbg.do("breakpoints") == "No breakpoints.\n"
        out, status = dbg.finish("c")
        assert status == 10
    finally:
        dbg.close()


def test_editing_a_local_changes_what_the_program_uses(tmp_path):
    write(tmp_path, "prog.py", """
        def scale(x):
            factor = 2
            result = x * factor
            return result


        print("result", scale(5))
    """)
    dbg = Session.debug(tmp_path, "--break", "prog.py:3", "prog.py")
    try:
        dbg.prompt()
        assert stop_line(dbg.do("c")) == "> prog.py:3 in scale()  (breakpoint 1)"
        assert dbg.do("factor = 7") == ""
        assert dbg.do("p factor") == "7\n"
        assert dbg.do("!x = 6") == ""
        assert "factor = 7" in dbg.do("locals")
        out, status = dbg.finish("c")
        assert "result 42" in out
        assert status == 0
    finally:
        dbg.close()


def test_jump_only_in_the_stopped_frame(tmp_path):
    write(tmp_path, "prog.py", """
        def work():
            value = 1
            value = 2
            value = 3
            return value


        print("value", work())
    """)
    dbg = Session.debug(tmp_path, "--break", "prog.py:3", "prog.py")
    try:
        dbg.prompt()
        dbg.do("c")
        dbg.do("up")
        assert "can only jump in the frame where the program stopped" in dbg.do("jump 4")
        dbg.do("down")
        assert dbg.do("jump 5").startswith("next line: 5")
        out, status = dbg.finish("c")
        assert "value 1" in out  # lines 3 and 4 were skipped
        assert status == 0
    finally:
        dbg.close()


def test_jump_skips_lines(tmp_path):
    write(tmp_path, "prog.py", """
        def work():
            value = 1
            value = value + 10
            value = value + 100
            return value


        print("value", work())
    """)
    dbg = Session.debug(tmp_path, "--break", "prog.py:3", "prog.py")
    try:
        dbg.prompt()
        dbg.do("c")
        dbg.do("n")
        assert dbg.do("j 5").startswith("next line: 5")
        out, status = dbg.finish("c")
        assert "value 11" in out  # line 4 was skipped
        assert status == 0
    finally:
        dbg.close()


def test_list_longlist_and_help(tmp_path, sum_program):
    dbg = Session.debug(tmp_path, "--break", "prog.py:5", "prog.py")
    try:
        dbg.prompt()
        dbg.do("c")
        listing = dbg.do("list").splitlines()
        assert "   5 B->     total = a + b" in listing
        assert listing[0].startswith("   1 ")
        assert dbg.do("ll").splitlines() == ["   4     def add(a, b):",
                                             "   5 B->     total = a + b",
                                             "   6         return total"]
        text = dbg.do("help")
        for name in ("step", "next", "until", "return", "continue", "jump", "where", "break",
                     "tbreak", "condition", "ignore", "breakpoints", "catch", "ignore-here",
                     "threads", "imports", "quit"):
            assert name in text
        assert "jump (j) LINE" in dbg.do("help j")
        dbg.finish("q")
    finally:
        dbg.close()


def test_bad_input_gives_one_line_and_the_session_goes_on(tmp_path, sum_program):
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        dbg.prompt()
        out = dbg.do("frobnicate now")
        assert out.startswith("*** unknown command or invalid Python") and out.count("\n") == 1
        assert dbg.do("break nosuch.py:3") == "*** no file 'nosuch.py'\n"
        assert dbg.do("break prog.py:abc") .startswith("*** ")
        assert dbg.do("break 3") == "*** line 3 of prog.py is blank or a comment\n"
        assert dbg.do("break 500") == "*** prog.py has no line 500\n"
        assert dbg.do("break 5, (") .startswith("*** bad condition")
        assert dbg.do("p undefined_name") == \
            "*** NameError: name 'undefined_name' is not defined\n"
        assert dbg.do("p 1/0") == "*** ZeroDivisionError: division by zero\n"
        assert dbg.do("clear 9") == "*** no breakpoint 9\n"
        assert dbg.do("ignore 1") == "*** usage: ignore NUMBER COUNT\n"
        assert dbg.do("jump x") == "*** jump: expected a number, not 'x'\n"
        assert dbg.do("catch sometimes").startswith("*** unknown exception mode")
        assert dbg.do("thread 7") .startswith("*** no thread 7")
        assert dbg.do("up") == "*** oldest frame\n"
        # Nothing of this changed the program.
        out, status = dbg.finish("c")
        assert "sum 10" in out and status == 10
    finally:
        dbg.close()


def test_end_of_input_quits(tmp_path, sum_program):
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        dbg.prompt()
        dbg.child.sendeof()
        out, status = dbg.finish()
        assert "sum" not in out
        assert status == 1
    finally:
        dbg.close()


def test_commands_option_and_exit_status(tmp_path, sum_program):
    dbg = Session.debug(tmp_path, "-c", "break 5", "-c", "continue", "prog.py")
    try:
        out = dbg.prompt()
        assert "Breakpoint 1 at prog.py:5" in out
        assert "(breakpoint 1)" in out
        assert dbg.do("p b") == "1\n"
        out, status = dbg.finish("quit")
        assert status == 1 and "sum" not in out
    finally:
        dbg.close()


def test_module_and_arguments(tmp_path):
    write(tmp_path, "pkg/__init__.py", "")
    write(tmp_path, "pkg/helper.py", "WORD = 'helped'\n")
    write(tmp_path, "pkg/__main__.py", """
        import sys
        from pkg.helper import WORD
        print("argv", sys.argv[1:], WORD, __name__, __package__)
        print("path0", sys.path[0])
    """)
    dbg = Session.debug(tmp_path, "-m", "pkg", "one", "--two")
    try:
        first = dbg.prompt()
        assert stop_line(first).endswith("__main__.py:1 in <module>()")
        out, status = dbg.finish("c")
        assert "argv ['one', '--two'] helped __main__ pkg" in out
        assert f"path0 {tmp_path}" in out
        assert status == 0
    finally:
        dbg.close()


def test_script_keeps_its_directory_and_neighbours(tmp_path):
    write(tmp_path, "app/neighbour.py", "NAME = 'neighbour'\n")
    write(tmp_path, "app/main.py", """
        import os, sys
        import neighbour
        print("cwd", os.getcwd())
        print("argv", sys.argv)
        print("path0", sys.path[0])
        print("name", neighbour.NAME, __name__)
    """)
    dbg = Session.debug(tmp_path, "app/main.py", "x")
    try:
        dbg.prompt()
        out, status = dbg.finish("c")
        assert f"cwd {tmp_path}" in out
        assert "argv ['app/main.py', 'x']" in out
        assert f"path0 {tmp_path / 'app'}" in out
        assert "name neighbour __main__" in out
        assert status == 0
    finally:
        dbg.close()


def test_program_reading_standard_input(tmp_path):
    write(tmp_path, "prog.py", """
        import sys
        lines = sys.stdin.read().splitlines()
        for number, line in enumerate(lines):
            print(number, line.upper())
        print("read", len(lines))
    """)
    (tmp_path / "input.txt").write_text("alpha\nbeta\ngamma\n")
    dbg = Session(None, tmp_path, shell=f"{sys.executable} -m selvane prog.py < input.txt")
    try:
        dbg.prompt()
        dbg.do("break 4")
        assert stop_line(dbg.do("c")) == "> prog.py:4 in <module>()  (breakpoint 1)"
        assert dbg.do("p lines") == "['alpha', 'beta', 'gamma']\n"
        dbg.do("clear 1")
        out, status = dbg.finish("c")
        assert "0 ALPHA" in out and "2 GAMMA" in out and "read 3" in out
        assert status == 0
    finally:
        dbg.close()


@pytest.mark.parametrize("ending", ["sys.exit(4)", "raise_it()"])
def test_output_and_exit_status_unchanged(tmp_path, ending):
    program = write(tmp_path, "prog.py", f"""
        import __main__, sys
        def raise_it():
            raise LookupError("the end")
        print("to stdout", sys.argv[1:], __name__, __main__.__builtins__, __file__)
        print("main", sorted(vars(__main__)), __main__.__spec__, __main__.__package__)
        print("to stderr", file=sys.stderr)
        sys.stdout.write("no newline at the end")
        {ending}
    """)
    plain = subprocess.run([sys.executable, str(program), "a"], capture_output=True,
                           text=True, cwd=tmp_path, timeout=30)
    dbg = Session(None, tmp_path, shell=f"{sys.executable} -m selvane --exceptions never "
                  "-c continue prog.py a > out.txt 2> err.txt")
    try:
        _out, status = dbg.finish()
    finally:
        dbg.close()
    assert status == plain.returncode == (4 if "exit" in ending else 1)
    assert (tmp_path / "out.txt").read_text() == plain.stdout
    assert (tmp_path / "err.txt").read_text() == plain.stderr


def test_missing_program_and_syntax_error(tmp_path):
    run = subprocess.run([sys.executable, "-m", "selvane", "nosuch.py"], capture_output=True,
                         text=True, cwd=tmp_path, timeout=30, env=environment())
    assert run.returncode == 2
    assert "can't open file" in run.stderr and "Traceback" not in run.stderr
    write(tmp_path, "bad.py", "x = (\n")
    run = subprocess.run([sys.executable, "-m", "selvane", "bad.py"], capture_output=True,
                         text=True, cwd=tmp_path, timeout=30, env=environment())
    assert run.returncode == 1
    assert "SyntaxError" in run.stderr and "Traceback" not in run.stderr
    run = subprocess.run([sys.executable, "-m", "selvane", "-m", "no_such_module"],
                         capture_output=True, text=True, cwd=tmp_path, timeout=30,
                         env=environment())
    assert run.returncode == 1
    assert "No module named" in run.stderr and "Traceback" not in run.stderr
    run = subprocess.run([sys.executable, "-m", "selvane", "--help"], capture_output=True,
                         text=True, cwd=tmp_path, timeout=30, env=environment())
    assert run.returncode == 0 and "usage: python -m selvane" in run.stdout
    assert "--exceptions" in run.stdout


def test_imports_lists_new_modules(tmp_path):
    write(tmp_path, "mine.py", "VALUE = 1\n")
    write(tmp_path, "prog.py", """
        import mine
        print(mine.VALUE)
    """)
    dbg = Session.debug(tmp_path, "prog.py")
    try:
        dbg.prompt()
        dbg.do("imports")
        dbg.do("n")
        assert "mine.py" in dbg.do("imports")
        assert dbg.do("imports") == "no new modules\n"
        dbg.finish("c")
    finally:
        dbg.close()


def test_the_console_stays_on_the_terminal_when_the_program_moves_its_descriptors(tmp_path):
    # As pytest's output capture does: descriptors 1 and 0 pointed at files (and sys.stdout
    # replaced). The console still reads and writes the terminal; the program's output goes
    # where it put it.
    write(tmp_path, "prog.py", """
        import io
        import os
        import sys

        out = os.open("captured.txt", os.O_WRONLY | os.O_CREAT | os.O_TRUNC)
        os.dup2(out, 1)
        os.dup2(os.open(os.devnull, os.O_RDONLY), 0)
        sys.stdout = io.TextIOWrapper(os.fdopen(1, "wb", closefd=False), line_buffering=True)
        print("to the file")
        value = 42
        print("value", value)
    """)
    dbg = Session.debug(tmp_path, "--break", "prog.py:11", "prog.py")
    try:
        dbg.prompt()
        out = dbg.do("c")
        assert stop_line(out) == "> prog.py:11 in <module>()  (breakpoint 1)"
        assert dbg.do("p value") == "42\n"
        out, status = dbg.finish("c")
        assert "to the file" not in out and "value 42" not in out
        assert "The program exited with status 0." in out
        assert status == 0
    finally:
        dbg.close()
    assert (tmp_path / "captured.txt").read_text() == "to the file\nvalue 42\n"
