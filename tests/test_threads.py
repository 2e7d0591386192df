"""Threads under the tracer: which threads may enter the debugger, thread names and bottom
frames, the per-thread policy callback, threads that exist before tracing starts, and
thread states reused by later threads.

Worker threads start with no stepping command, so they run freely; the tests make them stop
with exception mode 1 (always stop on an exception), raising and catching in the worker.
Stops outside the program's file are answered with continue_run, so that only the
program's own exceptions stop the threads.
"""

from conftest import assert_stops, ok, run_plain, run_traced

THREADED = dict(first="continue_run", default="continue_run", when_elsewhere="continue_run",
                exception_mode=1, record_threads=True)

HANDSHAKE = """
    import threading
    import time
    import _scripted_shared as shared

    def work():
        try:
            raise ValueError("w")
        except ValueError:
            pass

    def main():
        t = threading.Thread(target=work, name="worker")
        t.start()
        while not getattr(shared, "stopped", False):
            time.sleep(0.005)
        shared.go.set()
        t.join()
        print("done")

    main()
"""


def handshake_run(tmp_path, debug_all_threads):
    # The worker stops at its exception; while it sits in the callback it waits up to 1.5 s
    # for the main thread to set shared.go, which main does once it sees the worker stopped.
    return ok(run_traced(tmp_path, HANDSHAKE, debug_all_threads=debug_all_threads,
                         probe="setattr(shared, 'stopped', True)", wait_in={"worker": 1.5},
                         probe_after="core.get_curr_frame(shared.tids['main']) is not None",
                         **THREADED))


def test_with_all_threads_debugged_others_wait_for_the_stopped_thread(tmp_path):
    run = handshake_run(tmp_path, 1)
    # Main blocks on the core's mutex at its next event: go is never set while the worker is
    # stopped, and main's current frame is visible to get_curr_frame while it waits.
    assert_stops(run.stops, [("exception", "prog.py", 7, "work", "ValueError", "worker", None,
                              False, True)])
    assert run.stdout == "done\n"


def test_with_one_thread_at_a_time_others_run_untraced(tmp_path):
    run = handshake_run(tmp_path, 0)
    # Main runs on untraced while the worker is inside the debugger and sets go; it is not
    # inside the debugger, so get_curr_frame answers None for it.
    assert_stops(run.stops, [("exception", "prog.py", 7, "work", "ValueError", "worker", None,
                              True, False)])


SEQUENTIAL = """
    import threading

    def work(n):
        try:
            raise KeyError(n)
        except KeyError:
            return n

    for n in range(3):
        t = threading.Thread(target=work, args=(n,), name=f"w{n}")
        t.start()
        t.join()
    print("ok")
"""


def test_threads_started_one_after_another(tmp_path):
    # Thread states are reused by the interpreter for later threads: each new thread must
    # get a fresh record (its own name, stepping state and bottom frame).
    # The probe also asks is_botframe about the main thread's bottom frame: it answers for
    # the calling thread only, so 0.
    config = dict(THREADED, default="step_into",
                  probe="[core.get_thread_name(core.get_current_tstate_id()),"
                        " core.is_botframe(outermost(frame)),"
                        " core.is_botframe(outermost(sys._current_frames()"
                        "[threading.main_thread().ident]))]")
    run = ok(run_traced(tmp_path, SEQUENTIAL, **config))
    expected = []
    for n in range(3):
        expected += [
            ("exception", "prog.py", 5, "work", "KeyError", f"w{n}", ["run", 1, 0]),
            ("line", "prog.py", 6, "work", f"w{n}", ["run", 1, 0]),
            ("line", "prog.py", 7, "work", f"w{n}", ["run", 1, 0]),
            ("return", "prog.py", 7, "work", n, f"w{n}", ["run", 1, 0]),
        ]
    assert_stops([s for s in run.stops if s[-2] != "main"], expected)
    # Each worker left its record when it ended: only the main thread is still known.
    assert run.threads_after == 1


POLICY = """
    import threading

    def work():
        try:
            raise ValueError("w")
        except ValueError:
            pass

    for name in ("a", "b"):
        t = threading.Thread(target=work, name=name)
        t.start()
        t.join()
"""


def test_policy_callback_zero_ignores_the_thread(tmp_path):
    run = ok(run_traced(tmp_path, POLICY, thread_policy={"a": 0}, **THREADED))
    stopped = [s[-1] for s in run.stops]
    assert stopped == ["b"]
    # Asked once per thread: the answer is cached until the thread's bottom frame returns.
    assert [e for e in run.events if e[0] == "policy" and e[1] == "a"] == [["policy", "a", 0]]
    assert [e for e in run.events if e[0] == "policy" and e[1] == "b"] == [["policy", "b", 1]]


def test_policy_callback_that_raises_debugs_the_thread_and_is_not_asked_again(tmp_path):
    run = ok(run_traced(tmp_path, POLICY, thread_policy={"a": "raise"}, **THREADED))
    assert [s[-1] for s in run.stops] == ["a", "b"]
    assert [e for e in run.events if e[0] == "policy" and e[1] == "a"] == \
        [["policy", "a", "raise"]]
    assert "policy failure" not in run.stderr


def test_without_policy_callback_every_thread_is_debugged(tmp_path):
    run = ok(run_traced(tmp_path, POLICY, **THREADED))
    assert [s[-1] for s in run.stops] == ["a", "b"]
    assert not [e for e in run.events if e[0] == "policy"]


EARLY = """
    import _scripted_shared as shared

    shared.go.set()
    shared.early.join()
    print("joined")
"""

EARLY_PRELUDE = """
def deep():
    shared.go.wait(30)
    shared.go.clear()
    try:
        raise ValueError("late")
    except ValueError:
        pass

def outer():
    deep()

shared.early = threading.Thread(target=outer, name="early")
shared.early.start()
"""


def test_thread_running_before_start_trace_is_traced_from_then_on(tmp_path):
    # The thread waits in deep() when tracing starts, so it is named None (it stands deeper
    # than the function its bootstrap called) and still stops at its exception.
    run = ok(run_traced(tmp_path, EARLY, prelude=EARLY_PRELUDE, files=["prog.py", "<string>"],
                        probe="core.get_thread_name(core.get_current_tstate_id())",
                        **THREADED))
    assert_stops(run.stops, [("exception", "<string>", 6, "deep", "ValueError", "early", None)])
    assert run.stdout == "joined\n"


def test_traced_thread_program_output_matches_an_untraced_run(tmp_path):
    traced = run_traced(tmp_path, SEQUENTIAL, **THREADED)
    plain = run_plain(tmp_path, SEQUENTIAL)
    assert (traced.returncode, traced.stdout) == (plain.returncode, plain.stdout)


RAW_THREAD_PRELUDE = """
import _thread
import sys
sys.path.insert(0, shared.program_dir)
import mythreading

shared.lock = _thread.allocate_lock()
shared.lock.acquire()

def target():
    shared.ready.set()
    shared.lock.acquire()          # waits in C: target stays the innermost Python frame
    try:
        raise ValueError("raw")
    except ValueError:
        pass
    shared.done.set()

shared.done = threading.Event()
shared.ready = threading.Event()
_thread.start_new_thread(mythreading._bootstrap_inner, (target,))
shared.ready.wait(30)              # from here on the thread stands in target()
"""

RAW_THREAD = """
    import _scripted_shared as shared

    shared.lock.release()
    shared.done.wait(30)
    print("raw thread done")
"""


def test_bootstrap_frame_in_any_file_ending_in_threading_py(tmp_path):
    # The thread runs target() from _bootstrap_inner of mythreading.py: any file whose name
    # ends in "threading.py" counts as the threading bootstrap, so the thread is named after
    # the function the bootstrap called.
    (tmp_path / "mythreading.py").write_text("def _bootstrap_inner(target):\n    target()\n")
    prelude = f"shared.program_dir = {str(tmp_path)!r}\n" + RAW_THREAD_PRELUDE
    run = ok(run_traced(tmp_path, RAW_THREAD, prelude=prelude, files=["<string>"],
                        probe="core.get_thread_name(core.get_current_tstate_id())",
                        **THREADED))
    assert_stops(run.stops, [("exception", "<string>", 15, "target", "ValueError", "?",
                              "target")])
    assert run.stdout == "raw thread done\n"


def test_stop_trace_clears_the_trace_function_of_other_threads(tmp_path):
    # A thread that sits in C when tracing stops must not keep the core's trace function
    # until its next event: stop_trace clears it, so the thread's later events never reach
    # the core (which would say so on the debug channel).
    program = """
        import sys
        import threading
        import time
        import _scripted_shared as shared

        shared.release = threading.Event()
        shared.seen = []

        def sit():
            shared.release.wait(30)
            shared.seen.append(sys.gettrace())

        shared.thread = threading.Thread(target=sit, name="sitter")
        shared.thread.start()
        # Tracing stops only once the sitter waits inside Condition.wait, in C.
        while True:
            frame = sys._current_frames().get(shared.thread.ident)
            if frame is not None and frame.f_code.co_name == "wait" and \
                    frame.f_back is not None and frame.f_back.f_code.co_name == "wait":
                break
            time.sleep(0.001)
        time.sleep(0.05)
    """
    log = tmp_path / "debug.txt"
    run = ok(run_traced(tmp_path, program, first="continue_run", debug_file=str(log),
                        after_stop="[shared.release.set(), shared.thread.join(), "
                                   "repr(shared.seen)][2]"))
    assert run.after_stop == "[None]"
    assert "trace_dispatch called while not tracing" not in log.read_text()
