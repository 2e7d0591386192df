"""The console's `jump` under both event sources: it sets the next line of the frame where the
program stopped, at a line stop, and refuses every other case with a message, leaving the
program to run on as it would. Another frame's line is never set: 3.13 to 3.15 accept that
and crash when the frame resumes. Each test drives `python -m selvane` through a
pseudo-terminal (console_driver)."""

import sys

import pytest

from console_driver import Session, environment, stop_line, write

SOURCES = ["settrace", pytest.param("monitoring", marks=pytest.mark.skipif(
    sys.version_info < (3, 12), reason="3.11 has no sys.monitoring: the trace function is its "
                                       "only event source"))]

PROGRAM = """
def work():
    value = 1
    value = value + 10
    value = value + 100
    return value


def numbers():
    yield 1
    yield 2


print("value", work())
print("numbers", list(numbers()))
"""
PLAIN_OUTPUT = ["value 111", "numbers [1, 2]"]


@pytest.fixture(params=SOURCES)
def debug(request, tmp_path):
    """Starts the console on the program with SELVANE_EVENT_SOURCE set; closes it after."""
    write(tmp_path, "prog.py", PROGRAM)
    sessions = []

    def start(*args):
        session = Session.debug(tmp_path, *args, "prog.py",
                                env=environment(SELVANE_EVENT_SOURCE=request.param))
        sessions.append(session)
        session.prompt()
        return session

    yield start
    for session in sessions:
        session.close()


def output_lines(out):
    return [line for line in out.splitlines() if line.startswith(("value", "numbers"))]


def test_jump_forward_and_back_in_the_stopped_frame(debug):
    dbg = debug("--break", "prog.py:3")
    assert stop_line(dbg.do("c")) == "> prog.py:3 in work()  (breakpoint 1)"
    assert dbg.do("clear 1").startswith("Deleted")
    # Back to line 2: value = 1 again, then +10 and +100.
    assert dbg.do("jump 2") == "next line: 2\n-> value = 1\n"
    assert stop_line(dbg.do("n")) == "> prog.py:3 in work()"
    # Forward over the +10: the next stop is line 5.
    assert dbg.do("j 4") == "next line: 4\n-> value = value + 100\n"
    assert dbg.do("p value") == "1\n"
    assert stop_line(dbg.do("n")) == "> prog.py:5 in work()"
    out, status = dbg.finish("c")
    assert output_lines(out) == ["value 101", "numbers [1, 2]"]
    assert status == 0


def test_jump_in_a_caller_frame_is_refused(debug):
    dbg = debug("--break", "prog.py:3")
    dbg.do("c")
    assert dbg.do("up").startswith("> prog.py:13 in <module>()")
    out = dbg.do("jump 14")
    assert out == ("*** can only jump in the frame where the program stopped, not in another "
                   "frame (go back there with `down`)\n")
    # Nothing moved: the caller runs its own line, and the stopped frame can still jump.
    assert dbg.do("down").startswith("> prog.py:3 in work()")
    assert dbg.do("jump 4").startswith("next line: 4")
    out, status = dbg.finish("c")
    assert output_lines(out) == ["value 101", "numbers [1, 2]"]
    assert status == 0


def test_jump_at_a_return_stop_is_refused(debug):
    dbg = debug("--break", "prog.py:3")
    dbg.do("c")
    out = dbg.do("return")
    assert stop_line(out) == "> prog.py:5 in work()"
    assert "<- work() returns 111" in out
    assert dbg.do("jump 2") == ("*** cannot jump here: the function is returning; jump works "
                                "at a line stop (`step` to one first)\n")
    assert dbg.do("p value") == "111\n"
    out, status = dbg.finish("c")
    assert output_lines(out) == PLAIN_OUTPUT
    assert status == 0


def test_jump_at_a_yield_is_refused(debug):
    # 3.14 and later would give up the yield in progress: never attempted.
    dbg = debug("--break", "prog.py:9")
    out = dbg.do("c")
    assert stop_line(out) == "> prog.py:9 in numbers()  (breakpoint 1)"
    assert output_lines(out) == ["value 111"]
    out = dbg.do("return")
    assert stop_line(out) == "> prog.py:9 in numbers()"
    assert "<- numbers() returns 1" in out
    assert dbg.do("jump 10") == ("*** cannot jump here: the function is suspending at a "
                                 "yield; jump works at a line stop (`step` to one first)\n")
    assert dbg.do("clear 1").startswith("Deleted")
    out, status = dbg.finish("c")
    assert output_lines(out) == ["numbers [1, 2]"]
    assert status == 0


@pytest.mark.parametrize("source", SOURCES)
def test_jump_at_an_exception_stop_is_refused(tmp_path, source):
    write(tmp_path, "prog.py", """
        def fail():
            try:
                raise KeyError("k")
            except KeyError:
                return "caught"


        print(fail())
    """)
    dbg = Session.debug(tmp_path, "--exceptions", "always", "prog.py",
                        env=environment(SELVANE_EVENT_SOURCE=source))
    try:
        dbg.prompt()
        out = dbg.do("c")
        assert stop_line(out).startswith("> prog.py:3 in fail()"), out
        assert dbg.do("jump 5") == ("*** cannot jump at an exception stop: jump works at a "
                                    "line stop (`step` to one first)\n")
        out, status = dbg.finish("c")
        assert out.splitlines()[-2:] == ["caught", "The program exited with status 0."], out
        assert status == 0
    finally:
        dbg.close()
