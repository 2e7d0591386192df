"""Switching tracing on and off, containment of failures, injected exceptions, the idle
callback, autoquit and forked children. Every traced program runs in a subprocess."""

import os
import subprocess
import sys
import textwrap

import pytest

from conftest import MONITORING, assert_stops, ok, run_plain, run_traced

import tvantrel30pydebugstackless as core

SIMPLE = """
    def f(x):
        y = x * 2
        return y

    total = f(1) + f(2)
    print(total)
"""

# ---- stop_trace and reset -----------------------------------------------------------------

LINGERING = """
    import sys
    import threading
    import _scripted_shared as shared

    def foreign(frame, event, arg):
        return foreign

    def linger():
        shared.release.wait(30)

    def main():
        shared.release = threading.Event()
        shared.thread = threading.Thread(target=linger, name="linger")
        shared.thread.start()
        sys._getframe().f_trace = foreign   # set while tracing: must survive stop_trace
        print("main done")

    main()
"""

# Collects, for every frame of every thread after stop_trace, which kind of f_trace it has;
# then lets the lingering thread end.
FRAMES_AFTER_STOP = (
    "[sorted({(('ours' if f.f_trace is core.trace_dispatch else "
    "'foreign' if getattr(f.f_trace, '__name__', '') == 'foreign' else 'none'))"
    " for top in sys._current_frames().values() for f in __import__('traceback').walk_stack(top)"
    " for f in [f[0]]}), shared.release.set(), shared.thread.join()][0]"
)


def test_stop_trace_leaves_no_trace_dispatch_in_any_frame(tmp_path):
    run = ok(run_traced(tmp_path, LINGERING, first="continue_run", after_stop=FRAMES_AFTER_STOP))
    assert run.after_stop == ["none"]
    assert run.stdout == "main done\n"


def test_stop_trace_leaves_foreign_trace_functions(tmp_path):
    program = """
        import sys
        import _scripted_shared as shared

        def foreign(frame, event, arg):
            return foreign

        def keep():
            frame = sys._getframe()
            frame.f_trace = foreign
            shared.kept = frame
            return 1

        keep()
    """
    run = ok(run_traced(tmp_path, program, first="continue_run",
                        after_stop="shared.kept.f_trace.__name__"))
    assert run.after_stop == "foreign"


def test_get_tracing_stays_one_after_stop_trace(tmp_path):
    run = ok(run_traced(tmp_path, SIMPLE, first="continue_run"))
    assert run.tracing_after_stop == 1
    assert run.threads_after >= 1


def test_reset_from_a_callback_stops_tracing_everywhere(tmp_path):
    program = """
        import threading

        def work():
            try:
                raise ValueError(1)
            except ValueError:
                pass

        t = threading.Thread(target=work, name="w")
        t.start()
        t.join()
        print("done")
    """
    # Exception mode 1 would stop the worker at its exception; line 1 steps on, line 3
    # resets the core: nothing stops after that, in this thread or in the worker.
    run = ok(run_traced(tmp_path, program, exception_mode=1, commands=["step_into", "reset"],
                        record_threads=True))
    assert_stops(run.stops, [("line", "prog.py", 1, "<module>", "main"),
                             ("line", "prog.py", 3, "<module>", "main")])
    assert run.stdout == "done\n"


def test_start_trace_twice_installs_once(tmp_path):
    twice, once = tmp_path / "twice.txt", tmp_path / "once.txt"
    ok(run_traced(tmp_path, SIMPLE, first="continue_run", prelude="core.start_trace()",
                  debug_file=str(twice)))
    ok(run_traced(tmp_path, SIMPLE, first="continue_run", debug_file=str(once)))
    twice, once = twice.read_text(), once.read_text()
    assert twice.count("START TRACING\n") == 2
    assert once.count("START TRACING\n") == 1
    # Frames are walked after the first start only.
    first, second = twice.split("START TRACING\n")[1:]
    assert "inserting into thread state" in first
    assert "inserting into thread state" not in second.split("in __tracer_stop_trace()")[0]


# ---- failures are contained ---------------------------------------------------------------

RAISING = """
    def f():
        try:
            raise ValueError("mine")
        except ValueError as exc:
            print("caught", exc)
        return 5

    print(f())
"""


@pytest.mark.parametrize("where, stop_line", [
    ("line", "TRACER LINE STOPPED TRACER\n"),
    ("return", "TRACER RETURN STOPPED TRACER\n"),
    ("exception", "TRACER EXC STOPPED TRACER\n"),
])
def test_failing_callback_switches_tracing_off_for_the_thread(tmp_path, where, stop_line):
    log = tmp_path / "debug.txt"
    run = run_traced(tmp_path, RAISING, fail_in=where, exception_mode=1, debug_file=str(log),
                     default="step_into")
    plain = run_plain(tmp_path, RAISING)
    # The program neither sees the failure nor loses its own exception.
    assert (run.returncode, run.stdout) == (plain.returncode, plain.stdout)
    assert stop_line in log.read_text()
    assert f"{where} callback failure" in run.stderr  # reported, as an unraisable error
    assert run.stops == []  # the failing callback recorded nothing, and nothing stopped later


SPIN = """
    import time

    def spin(seconds):
        end = time.time() + seconds
        n = 0
        while time.time() < end:
            n += 1
        return n

    spin(2.4)
    print("spun")
"""


def test_failing_idle_callback_is_logged_and_tracing_goes_on(tmp_path):
    log = tmp_path / "debug.txt"
    run = ok(run_traced(tmp_path, SPIN, first="continue_run", idle_period=0.1, fail_in="idle",
                        debug_file=str(log)))
    assert run.stdout == "spun\n"
    assert "idle callback failure" in log.read_text()
    assert len([e for e in run.events if e == ["idle"]]) >= 2


# ---- injected exceptions ------------------------------------------------------------------

INJECT = """
    try:
        x = 1
        y = 2
        z = 3
    except ValueError as exc:
        print("caught", exc)
    else:
        print("no exception")
"""


def test_raise_exception_is_raised_at_the_next_event(tmp_path):
    run = ok(run_traced(tmp_path, INJECT, commands=["step_into", ["raise_exception", "ValueError",
                                                                  "injected"]],
                        default="continue_run"))
    # Injected while stopped at line 2; the next event (line 3) raises it before y = 2 runs,
    # and the stepping thread stops at that exception.
    assert_stops(run.stops, [("line", "prog.py", 1, "<module>"), ("line", "prog.py", 2, "<module>"),
                             ("exception", "prog.py", 3, "<module>", "ValueError")])
    assert run.stdout == "caught injected\n"


def test_raise_exception_none_clears_the_pending_exception(tmp_path):
    run = ok(run_traced(tmp_path, INJECT, default="continue_run",
                        commands=["step_into", ["seq", ["raise_exception", "ValueError", "x"],
                                                ["raise_exception", None]]]))
    assert run.stdout == "no exception\n"


def test_raise_exception_rejects_bad_arguments():
    with pytest.raises(TypeError):
        core.raise_exception(0, 5)
    with pytest.raises(TypeError):
        core.raise_exception("thread", ValueError())
    with pytest.raises(TypeError):
        core.raise_exception(0)


# ---- idle and quit ------------------------------------------------------------------------




def test_idle_callback_runs_at_most_once_a_second(tmp_path):
    run = ok(run_traced(tmp_path, SPIN, first="continue_run", idle_period=0.5))
    idles = len([e for e in run.events if e == ["idle"]])
    assert 1 <= idles <= 4  # 2.4 s of events: at most one call per started second


def test_idle_period_zero_never_calls_the_idle_callback(tmp_path):
    run = ok(run_traced(tmp_path, SPIN, first="continue_run", idle_period=0.0))
    assert ["idle"] not in run.events


SPIN_IN_A_THREAD = """
    import os, threading, time
    try:
        import _scripted_shared as shared
    except ImportError:  # the untraced run
        import types
        shared = types.ModuleType("plain")

    def spin(seconds):
        end = time.monotonic() + seconds
        n = 0
        while time.monotonic() < end:
            n += 1
        return n

    def work():
        shared.spin_window = [time.monotonic()]
        shared.tasks_while_running = len(os.listdir("/proc/self/task"))
        spin(SECONDS)
        shared.spin_window.append(time.monotonic())

    worker = threading.Thread(target=work)
    worker.start()
    worker.join()
    print("spun")
"""

TASK_COUNTS = """
import os, time
def tasks():
    return len(os.listdir("/proc/self/task"))
def settle(target):
    end = time.monotonic() + 5
    while tasks() > target and time.monotonic() < end:
        time.sleep(0.01)
    return tasks()
shared.settle = settle
shared.tasks_before = tasks()
shared.idle_times = []
"""


@pytest.mark.parametrize("idle_period", [0.5, 0.0])
def test_idle_callback_runs_while_a_thread_runs_freely(tmp_path, idle_period):
    """A thread spins in a loop without calls while the main thread waits in join(): the idle
    callback still runs about once a second during the spin, whichever source delivers the
    events (sys.monitoring sends none from places that went quiet: a native ticker brings
    them back while an idle period is set). After stop_trace no thread of the core is left."""
    seconds = 3.2 if idle_period > 0 else 0.5  # without an idle period nothing is awaited
    program = SPIN_IN_A_THREAD.replace("SECONDS", str(seconds))
    run = ok(run_traced(tmp_path, program, first="continue_run",
                        idle_period=idle_period, prelude=TASK_COUNTS,
                        idle_exec="shared.idle_times.append(time.monotonic())",
                        after_stop="[shared.spin_window, shared.idle_times, shared.tasks_before,"
                                   " shared.tasks_while_running,"
                                   " shared.settle(shared.tasks_before)]"))
    assert run.stdout == "spun\n"
    (start, end), times, before, running, after = run.after_stop
    during = [t for t in times if start < t < end]
    if idle_period > 0:
        assert len(during) >= 2, (start, end, times)
        # The worker, and under sys.monitoring the ticker.
        assert running == before + (2 if MONITORING else 1)
    else:
        assert times == []
        assert running == before + 1
    assert after == before


EXIT_WHILE_TICKING = """
    import os, sys, time
    sys.path.insert(0, TESTS)
    import tvantrel30pydebugstackless as core
    from core_args import init_args

    def spin(seconds):
        end = time.monotonic() + seconds
        while time.monotonic() < end:
            pass

    idles = []
    core.init(*init_args(idle_period=0.5, idle_cb=lambda: idles.append(time.monotonic())))
    core.start_trace()
    core.continue_run()
    spin(1.2)
    pid = os.fork()
    if pid == 0:
        spin(0.6)  # the parent's ticker does not exist here; exiting must not wait for it
        sys.exit(0)
    forked_at = time.monotonic()
    _, status = os.waitpid(pid, 0)
    print("child", os.waitstatus_to_exitcode(status))
    spin(2.2)
    print("idle after the fork", any(t > forked_at for t in idles))
    core.init(*init_args(idle_period=0.5))  # a second session, started again
    core.start_trace()
    spin(1.2)
    print("ending while tracing")
"""


def test_the_process_ends_while_the_idle_ticker_runs(tmp_path):
    """Tracing still on at exit, the idle ticker running (under sys.monitoring), a forked child
    that exits normally: both processes end at once and cleanly, the fork warns of no thread
    of ours, and the idle callback goes on in the parent after the fork."""
    program = EXIT_WHILE_TICKING.replace("TESTS", repr(os.path.dirname(__file__)))
    run = run_plain(tmp_path, program)
    assert run.returncode == 0, run.stderr
    assert run.stdout == "child 0\nidle after the fork True\nending while tracing\n"
    assert run.stderr == ""


def test_quit_callback_when_the_bottom_frame_returns(tmp_path):
    run = ok(run_traced(tmp_path, SIMPLE, first="continue_run", autoquit=1, stop_in_atexit=True))
    quits = [e for e in run.events if e[0] == "quit"]
    # The server's own module frame is the bottom frame: it returns once the program has
    # run. Code that runs after it (interpreter shutdown) gets a new bottom frame, whose
    # return quits again.
    assert quits and set(map(tuple, quits)) == {("quit", "main")}
    assert run.stdout == "6\n"


def test_no_quit_callback_without_autoquit(tmp_path):
    run = ok(run_traced(tmp_path, SIMPLE, first="continue_run", autoquit=0, stop_in_atexit=True))
    assert [e for e in run.events if e[0] == "quit"] == []


# ---- forked children ----------------------------------------------------------------------

FORK = """
    import os
    import _scripted_shared as shared

    def lines():
        a = 1
        b = 2
        return a + b

    read_end, write_end = os.pipe()
    pid = os.fork()
    if pid == 0:
        before = len(shared.server.stops)
        lines()
        os.write(write_end, str(len(shared.server.stops) - before).encode())
        os._exit(0)
    os.waitpid(pid, 0)
    print("child stops:", os.read(read_end, 100).decode())
    before = len(shared.server.stops)
    lines()
    print("parent stops:", len(shared.server.stops) - before)
"""


def test_forked_child_is_not_traced(tmp_path):
    run = ok(run_traced(tmp_path, FORK, default="step_into"))
    child, parent = run.stdout.splitlines()
    assert child == "child stops: 0"
    assert parent != "parent stops: 0"


# ---- the program does not notice the debugger ---------------------------------------------

EXIT_STATUS = """
    import sys
    print("before")
    sys.exit(3)
"""


def test_exit_status_and_output_pass_through(tmp_path):
    for program in (SIMPLE, EXIT_STATUS, RAISING):
        traced = run_traced(tmp_path, program, default="step_into")
        plain = run_plain(tmp_path, program)
        assert (traced.returncode, traced.stdout) == (plain.returncode, plain.stdout)


def test_uncaught_exception_exit_status_passes_through(tmp_path):
    program = """
        def boom():
            raise KeyError("gone")
        boom()
    """
    traced = run_traced(tmp_path, program, default="step_into")
    plain = run_plain(tmp_path, program)
    assert traced.returncode == plain.returncode == 1
    assert traced.stderr.strip().splitlines()[-1] == plain.stderr.strip().splitlines()[-1]


def test_reset_keeps_the_line_callback(tmp_path):
    program = """
        a = 1
        b = 2
    """
    # Reset from the first stop: the core stops tracing, but keeps its callbacks; the
    # server starts tracing again and the line callback is still the one given to init.
    run = ok(run_traced(tmp_path, program,
                        commands=[["seq", "reset", "step_into", "start_trace"]],
                        default="continue_run"))
    assert_stops(run.stops, [("line", "prog.py", 1, "<module>"),
                             ("line", "prog.py", 2, "<module>")])


def test_the_thread_hooks_callback_is_not_traced(tmp_path):
    # start_trace calls install_thread_hooks_cb(1) once tracing is on for the calling thread:
    # with a step pending, nothing may stop inside the server side's callback.
    script = tmp_path / "hooks.py"
    script.write_text(textwrap.dedent("""
        import builtins, threading
        import tvantrel30pydebugstackless as core
        stops, flags = [], []
        def hooks(flag):
            flags.append(flag)
            threading.settrace(core.bootstrap_new_thread if flag else None)
        def line_cb(frame, changed):
            stops.append(frame.f_code.co_name)
            core.continue_run()
        def program():
            return 1
        core.init(0.0, 0, hooks, lambda: None, line_cb, lambda f, v, c: core.continue_run(),
                  lambda f, e, c: core.continue_run(), lambda: None, None, builtins.__import__,
                  None, {})
        core.step_into()
        core.start_trace()
        program()
        core.stop_trace()
        print(flags, stops)
    """))
    proc = subprocess.run([sys.executable, str(script)], capture_output=True, text=True,
                          timeout=60)
    assert proc.returncode == 0, proc.stderr
    assert proc.stdout == "[1, 0] ['<module>']\n"
