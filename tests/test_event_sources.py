"""The two event sources of the core: the trace function and, on 3.12 and later,
sys.monitoring (SELVANE_EVENT_SOURCE, read at init). Choosing one, refusing a bad choice or a
tool id someone else holds, leaving nothing behind at stop_trace, and giving the server side
the same stops whichever source delivers the events.

Every test runs its program in a subprocess with the source set explicitly, so the file
means the same whatever SELVANE_EVENT_SOURCE the suite itself runs under."""

import json
import os
import subprocess
import sys
import textwrap

import pytest

from conftest import HERE, TIMEOUT, assert_stops, ok, run_plain, run_traced

HAS_MONITORING = sys.version_info >= (3, 12)
ONE_SOURCE = "3.11 has no sys.monitoring: the trace function is its only event source"
needs_monitoring = pytest.mark.skipif(not HAS_MONITORING, reason=ONE_SOURCE)
SOURCES = ["settrace", pytest.param("monitoring", marks=needs_monitoring)]

BAD_SOURCE = "SELVANE_EVENT_SOURCE must be 'settrace' or 'monitoring', not '{}'"


def run_script(tmp_path, source, event_source, stdin=None):
    """Runs PREAMBLE and `source` in a fresh interpreter with SELVANE_EVENT_SOURCE set (None:
    unset), the tests folder on the path; the script prints one JSON value as its last line,
    which is returned with the completed process."""
    script = tmp_path / "script.py"
    script.write_text(textwrap.dedent(PREAMBLE) + textwrap.dedent(source))
    env = dict(os.environ, PYTHONPATH=HERE)
    env.pop("SELVANE_EVENT_SOURCE", None)
    if event_source is not None:
        env["SELVANE_EVENT_SOURCE"] = event_source
    try:
        proc = subprocess.run([sys.executable, str(script)], capture_output=True, text=True,
                              timeout=TIMEOUT, cwd=str(tmp_path), env=env, input=stdin)
    except subprocess.TimeoutExpired as hang:
        pytest.fail(f"script did not end within {TIMEOUT} s:\n{hang.stderr}")
    assert proc.returncode == 0, proc.stderr
    lines = proc.stdout.strip().splitlines()
    assert lines, proc.stderr
    return json.loads(lines[-1]), proc


def write_program_file(tmp_path, source, name="prog.py"):
    path = tmp_path / name
    path.write_text(textwrap.dedent(source).lstrip("\n"))
    return str(path)


# What every script of run_script starts with: a stop counter and a function with a
# breakpoint on its second line, to see whether the core traces.
PREAMBLE = """
    import builtins
    import json
    import os
    import sys

    import tvantrel30pydebugstackless as core
    from core_args import init_args

    stops = []

    def line_cb(frame, changed):
        stops.append([frame.f_code.co_name, frame.f_lineno])
        core.continue_run()

    def target():
        value = 1
        return value

    TARGET_LINE = target.__code__.co_firstlineno + 1

    def monitoring_state():
        if not hasattr(sys, "monitoring"):
            return None
        return [sys.monitoring.get_tool(0), sys.monitoring.get_events(0)]
"""


# ---- choosing the source at init ------------------------------------------------------------

@pytest.mark.parametrize("value", ["Monitoring", "trace", " monitoring", "monitoring ",
                                   "SETTRACE", "sys.monitoring", "0", "settrace,monitoring"])
def test_unknown_source_is_refused_at_init_and_changes_nothing(tmp_path, value):
    result, _ = run_script(tmp_path, """
        import_before = builtins.__import__
        errors = []
        try:
            core.init(*init_args(line_cb=line_cb))
        except Exception as error:
            errors.append([type(error).__name__, str(error)])
        untouched = [builtins.__import__ is import_before, sys.gettrace() is None,
                     core.get_tracing(), monitoring_state()]
        # Now a good value: the same core initialises and stops at the breakpoint.
        os.environ["SELVANE_EVENT_SOURCE"] = "settrace"
        core.init(*init_args(line_cb=line_cb))
        core.set_break(__file__, TARGET_LINE, 1, 0, None, 0)
        core.start_trace()
        target()
        core.stop_trace()
        print(json.dumps([errors, untouched, stops]))
    """, value)
    errors, untouched, stops = result
    assert errors == [["ValueError", BAD_SOURCE.format(value)]]
    no_monitoring = [None, 0] if HAS_MONITORING else None
    assert untouched == [True, True, 0, no_monitoring]
    assert [s[0] for s in stops] == ["target"]


def test_unknown_source_after_a_good_init_keeps_the_first(tmp_path):
    """A failed init leaves the core as the last good one made it: its callbacks, its
    breakpoints, its source."""
    result, _ = run_script(tmp_path, """
        core.init(*init_args(line_cb=line_cb))
        core.set_break(__file__, TARGET_LINE, 1, 0, None, 0)
        hook = builtins.__import__
        os.environ["SELVANE_EVENT_SOURCE"] = "sysmon"
        try:
            core.init(*init_args())
            refused = None
        except ValueError as error:
            refused = str(error)
        kept = [builtins.__import__ is hook, len(core.get_breaks(__file__, TARGET_LINE))]
        core.start_trace()
        state = monitoring_state()
        target()
        core.stop_trace()
        print(json.dumps([refused, kept, state, stops]))
    """, "settrace")
    refused, kept, state, stops = result
    assert refused == BAD_SOURCE.format("sysmon")
    assert kept == [True, 1]
    # Still the trace function, as the first init chose: no monitoring tool was taken.
    assert state == ([None, 0] if HAS_MONITORING else None)
    assert stops == [["target", stops[0][1]]]


DEFAULT_SOURCE_SCRIPT = """
    core.init(*init_args(line_cb=line_cb))
    core.set_break(__file__, TARGET_LINE, 1, 0, None, 0)
    core.start_trace()
    during = [sys.gettrace() is not None, monitoring_state()]
    target()
    core.stop_trace()
    print(json.dumps([during, stops]))
"""


def test_settrace_takes_the_trace_function_and_no_tool_id(tmp_path):
    result, _ = run_script(tmp_path, DEFAULT_SOURCE_SCRIPT, "settrace")
    during, stops = result
    assert during == [True, [None, 0] if HAS_MONITORING else None]
    assert [s[0] for s in stops] == ["target"]


@pytest.mark.parametrize("value", [None, ""])
def test_the_default_is_sys_monitoring_where_the_interpreter_has_it(tmp_path, value):
    result, _ = run_script(tmp_path, DEFAULT_SOURCE_SCRIPT, value)
    during, stops = result
    if HAS_MONITORING:
        tracing, (tool, events) = during
        assert (tracing, tool) == (False, "selvane")
        assert events != 0
    else:
        assert during == [True, None]
    assert [s[0] for s in stops] == ["target"]


def test_monitoring_source_needs_3_12(tmp_path):
    result, _ = run_script(tmp_path, """
        try:
            core.init(*init_args(line_cb=line_cb))
        except RuntimeError as error:
            print(json.dumps(["refused", str(error), core.get_tracing()]))
            raise SystemExit
        core.set_break(__file__, TARGET_LINE, 1, 0, None, 0)
        core.start_trace()
        during = [sys.gettrace() is None, monitoring_state()]
        target()
        core.stop_trace()
        print(json.dumps(["works", during, stops]))
    """, "monitoring")
    if HAS_MONITORING:
        assert result[0] == "works", result
        during, stops = result[1:]
        assert during[0] is True  # no trace function: the events come from sys.monitoring
        assert during[1][0] == "selvane" and during[1][1] != 0
        assert [s[0] for s in stops] == ["target"]
    else:
        assert result == ["refused", "sys.monitoring is not available in this interpreter "
                                     "(Python 3.12 or later has it)", 0]


# ---- the debugger's tool id held by someone else --------------------------------------------

@needs_monitoring
def test_tool_id_held_by_another_tool_refuses_start_and_changes_nothing(tmp_path):
    result, _ = run_script(tmp_path, """
        M = sys.monitoring
        seen = []
        def other_start(code, offset):
            seen.append(code.co_name)
        M.use_tool_id(M.DEBUGGER_ID, "other")
        M.set_events(M.DEBUGGER_ID, M.events.PY_START)
        M.register_callback(M.DEBUGGER_ID, M.events.PY_START, other_start)
        core.init(*init_args(line_cb=line_cb))
        core.set_break(__file__, TARGET_LINE, 1, 0, None, 0)
        try:
            core.start_trace()
            refused = None
        except RuntimeError as error:
            refused = str(error)
        after_refusal = [core.get_tracing(), sys.gettrace() is None, monitoring_state()]
        target()
        # The other tool still gets its events through its own callback.
        kept_callback = "target" in seen
        stops_while_held = list(stops)
        # The other tool leaves: now the debugger can take the id.
        M.set_events(M.DEBUGGER_ID, 0)
        M.register_callback(M.DEBUGGER_ID, M.events.PY_START, None)
        M.free_tool_id(M.DEBUGGER_ID)
        core.start_trace()
        taken = monitoring_state()[0]
        target()
        core.stop_trace()
        print(json.dumps([refused, after_refusal, kept_callback, stops_while_held, taken,
                          stops, monitoring_state()]))
    """, "monitoring")
    refused, after_refusal, kept_callback, held_stops, taken, stops, final = result
    assert refused is not None and "'other'" in refused
    assert "SELVANE_EVENT_SOURCE=settrace" in refused
    py_start = 1  # the same bit in every version's numbering
    assert after_refusal == [0, True, ["other", py_start]]
    assert kept_callback is True
    assert held_stops == []
    assert taken == "selvane"
    assert [s[0] for s in stops] == ["target"]
    assert final == [None, 0]


@needs_monitoring
def test_tool_id_held_refusal_leaves_the_trace_function_source_usable(tmp_path):
    """The way out the refusal names: the trace function does not need the id."""
    result, _ = run_script(tmp_path, """
        M = sys.monitoring
        M.use_tool_id(M.DEBUGGER_ID, "other")
        core.init(*init_args(line_cb=line_cb))
        try:
            core.start_trace()
        except RuntimeError:
            pass
        os.environ["SELVANE_EVENT_SOURCE"] = "settrace"
        core.init(*init_args(line_cb=line_cb))
        core.set_break(__file__, TARGET_LINE, 1, 0, None, 0)
        core.start_trace()
        target()
        core.stop_trace()
        print(json.dumps([stops, monitoring_state()]))
    """, "monitoring")
    stops, state = result
    assert [s[0] for s in stops] == ["target"]
    assert state == ["other", 0]


PDB_PROGRAM = """
    import pdb

    def later():
        x = 5
        return x

    try:
        pdb.set_trace()
        print("after set_trace")
    except ValueError as error:
        print("pdb refused:", error)
    print("later", later())
"""


@pytest.mark.parametrize("source", SOURCES)
def test_pdb_set_trace_in_the_program(tmp_path, monkeypatch, source):
    """What a pdb.set_trace() (or breakpoint()) left in a program meets under the core.

    pdb of 3.14 and later builds its debugger on sys.monitoring with the debugger's tool id:
    while the core holds that id under sys.monitoring, pdb raises ValueError ("Another
    debugger is using the monitoring tool") into the program, which may catch it; the core
    keeps its breakpoints. Up to 3.13, and with the trace function on any version, pdb
    installs its own trace function: it runs (here: one `c` from standard input) and the
    program goes on. Where pdb uses the trace function (up to 3.13) and the core does too,
    pdb's sys.settrace replaces the core's trace function in that thread, so the core's later
    breakpoints there are lost; in every other pairing the two use different hooks and the
    core still stops. In every case the program ends as it would and nothing crashes."""
    monkeypatch.setenv("SELVANE_EVENT_SOURCE", source)
    program = write_program_file(tmp_path, PDB_PROGRAM)
    config = dict(program=program, out=str(tmp_path / "stops.json"), first="continue_run",
                  breaks=[[program, 4, 1, 0, None, 0]])
    (tmp_path / "config.json").write_text(json.dumps(config))
    proc = subprocess.run([sys.executable, os.path.join(HERE, "scripted_server.py"),
                           str(tmp_path / "config.json")], input="c\n", capture_output=True,
                          text=True, timeout=TIMEOUT, cwd=str(tmp_path))
    assert proc.returncode == 0, proc.stderr
    stops = [tuple(s) for s in json.loads((tmp_path / "stops.json").read_text())["stops"]]
    pdb_monitoring = sys.version_info >= (3, 14)
    if source == "monitoring" and pdb_monitoring:
        assert "pdb refused: Another debugger is using the monitoring tool" in proc.stdout
        assert "(Pdb)" not in proc.stdout
    else:
        assert "(Pdb)" in proc.stdout and "after set_trace" in proc.stdout
    assert proc.stdout.endswith("later 5\n")
    if source == "settrace" and not pdb_monitoring:
        assert stops == []
    else:
        assert stops == [("line", "prog.py", 4, "later")]


# ---- stop_trace leaves nothing behind ---------------------------------------------------------

# Every event sys.monitoring has in this interpreter, by name.
ALL_EVENTS = ("[n for n in dir(sys.monitoring.events) if n.isupper() and n != 'NO_EVENTS']")


@needs_monitoring
def test_stop_trace_releases_the_tool_id_events_and_callbacks(tmp_path, monkeypatch):
    monkeypatch.setenv("SELVANE_EVENT_SOURCE", "monitoring")
    program = """
        import _scripted_shared as shared

        def work(n):
            total = 0
            for i in range(n):
                total += i
            return total

        shared.work = work
        print(work(3))
    """
    # After stop_trace: nobody holds the id, no event is on, no callback registered (the
    # previous callback register_callback hands back is None for every event), and no local
    # event is left on the program's function for the next holder of the id to inherit.
    after_stop = (
        "[sys.monitoring.get_tool(0), sys.monitoring.get_events(0), "
        "sorted({repr(sys.monitoring.register_callback(0, getattr(sys.monitoring.events, n), "
        "None)) for n in " + ALL_EVENTS + "}), "
        "[sys.monitoring.use_tool_id(0, 'probe'), "
        "sys.monitoring.get_local_events(0, shared.work.__code__), "
        "sys.monitoring.free_tool_id(0)][1]]"
    )
    # A step into every line turns on line events for the function.
    run = ok(run_traced(tmp_path, program, default="step_into", after_stop=after_stop))
    assert ("line", "prog.py", 5, "work") in run.stops
    assert run.after_stop == [None, 0, ["None"], 0]
    assert run.stdout == "3\n"


@pytest.mark.parametrize("source", SOURCES)
def test_program_runs_untraced_after_stop_trace(tmp_path, source):
    """The program's own code after stop_trace: no stop, whatever was asked before (a step
    into the next line), and no event source left behind."""
    result, proc = run_script(tmp_path, """
        def step_cb(frame, changed):
            stops.append([frame.f_code.co_name, frame.f_lineno])
            core.step_into()

        core.init(*init_args(line_cb=step_cb, return_cb=lambda *a: step_cb(*a[:1], None)))
        core.set_break(__file__, TARGET_LINE, 1, 0, None, 0)
        core.start_trace()
        target()
        core.stop_trace()
        counted = len(stops)
        for _ in range(3):
            target()
        print("untraced run", target())
        print(json.dumps([counted, len(stops), sys.gettrace() is None, monitoring_state()]))
    """, source)
    counted, total, no_trace, state = result
    assert counted >= 1 and total == counted
    assert no_trace is True
    assert state == ([None, 0] if HAS_MONITORING else None)
    assert "untraced run 1" in proc.stdout


@pytest.mark.parametrize("source", SOURCES)
def test_twenty_start_stop_cycles(tmp_path, source):
    result, _ = run_script(tmp_path, """
        core.init(*init_args(line_cb=line_cb))
        core.set_break(__file__, TARGET_LINE, 1, 0, None, 0)
        per_cycle = []
        states = set()
        for cycle in range(20):
            before = len(stops)
            core.start_trace()
            target()
            core.stop_trace()
            target()  # untraced: no stop
            per_cycle.append(len(stops) - before)
            states.add(repr([sys.gettrace(), monitoring_state()]))
        print(json.dumps([per_cycle, sorted(states)]))
    """, source)
    per_cycle, states = result
    assert per_cycle == [1] * 20
    assert states == [repr([None, [None, 0] if HAS_MONITORING else None])]


# ---- the same stops from both sources ---------------------------------------------------------

DIFFERENTIAL_PROGRAMS = {
    "generators": """
        def gen(n):
            for i in range(n):
                yield i
            return "done"

        def delegate():
            result = yield from gen(2)
            return result

        def guarded():
            try:
                yield 1
                yield 2
            finally:
                print("closed")

        def use():
            total = sum(gen(3))
            g = guarded()
            next(g)
            g.close()
            g = gen(3)
            next(g)
            try:
                g.throw(ValueError("thrown"))
            except ValueError:
                pass
            print(list(delegate()), total)

        use()
    """,
    "coroutines": """
        import asyncio

        async def inner(x):
            await asyncio.sleep(0)
            return x * 2

        async def outer():
            a = await inner(1)
            b = await inner(2)
            return a + b

        class Ready:
            def __await__(self):
                value = yield "suspended"
                return value

        async def manual():
            got = await Ready()
            return got + 1

        coro = manual()
        print(coro.send(None))
        try:
            coro.send(41)
        except StopIteration as stop:
            print("manual", stop.value)
        print(asyncio.run(outer()))
    """,
    "exceptions": """
        def deep(n):
            if n == 0:
                raise KeyError(n)
            return deep(n - 1)

        def caught():
            try:
                deep(2)
            except KeyError:
                value = "caught"
            try:
                {}["missing"]
            except LookupError:
                pass
            try:
                int("x")
            except ValueError as error:
                value = str(error)
            return value

        def finally_path():
            try:
                raise RuntimeError("in try")
            finally:
                print("finally")

        print(caught())
        try:
            finally_path()
        except RuntimeError:
            pass
        deep(1)
    """,
    "one_line": """
        def one(x): return x + 1
        square = lambda y: y * y
        def two(a, b): c = a + b; return c
        print(one(2), square(3), two(1, 2))
        print(list(map(lambda z: z - 1, [1, 2])), sum(i for i in range(3)))
        print(sorted([3, 1, 2], key=lambda v: -v))
    """,
    "one_line_loops": """
        t = 0
        for i in range(3): t += i
        n = 0
        while n < 3: n += 1
        squares = [k * k for k in range(3)]
        def loop(): s = 0; return [s := s + j for j in range(2)]
        print(t, n, squares, loop())
    """,
    "threads": """
        import threading

        def work(k):
            s = 0
            for i in range(k):
                s += i
            return s

        results = []
        for name in ("w1", "w2"):
            t = threading.Thread(target=lambda: results.append(work(3)), name=name)
            t.start()
            t.join()
        print(results)
    """,
}

# Stepping commands: into everything; a mix of into, over and out; breakpoints only.
SCRIPTS = {
    "step_into": dict(default="step_into"),
    "mixed": dict(cycle=["step_into", "step_over", "step_into", "step_out"]),
}


def traced_with(tmp_path, monkeypatch, source, program, break_lines=(), **config):
    """Traces `program` under `source`, in a folder of its own, with breakpoints (enabled,
    permanent) at `break_lines` of it."""
    monkeypatch.setenv("SELVANE_EVENT_SOURCE", source)
    folder = tmp_path / source
    folder.mkdir(exist_ok=True)
    path = str(folder / "prog.py")
    config["breaks"] = [[path, line, 1, 0, None, 0] for line in break_lines]
    return run_traced(folder, program, **config)


def per_thread(stops):
    """Stops grouped by thread, in order: threads run one after another here, but the
    order in which two of them are seen between stops is the scheduler's."""
    groups = {}
    for stop in stops:
        groups.setdefault(stop[-1], []).append(stop)
    return groups


# Exception modes (never, always, unhandled) matter only for the programs that raise.
RAISING = ("coroutines", "exceptions", "generators")
PROGRAM_MODES = [(name, mode) for name in sorted(DIFFERENTIAL_PROGRAMS)
                 for mode in ((0, 1, 2) if name in RAISING else (0,))]


@needs_monitoring
@pytest.mark.parametrize("script", sorted(SCRIPTS))
@pytest.mark.parametrize("name, exception_mode", PROGRAM_MODES)
def test_both_sources_give_the_same_stops(tmp_path, monkeypatch, name, exception_mode, script):
    program = textwrap.dedent(DIFFERENTIAL_PROGRAMS[name]).lstrip("\n")
    config = dict(SCRIPTS[script], exception_mode=exception_mode, record_threads=True)
    # New threads run freely until something stops them: a breakpoint in the worker.
    config["break_lines"] = [4] if name == "threads" else []
    runs = {source: traced_with(tmp_path, monkeypatch, source, program, **config)
            for source in ("settrace", "monitoring")}
    plain = run_plain(tmp_path, program)
    for source, run in runs.items():
        assert (run.returncode, run.stdout) == (plain.returncode, plain.stdout), source
    trace, monitoring = runs["settrace"].stops, runs["monitoring"].stops
    assert len(trace) > 3, "the script should stop often in the program"
    if name == "threads":
        assert set(per_thread(trace)) >= {"w1", "w2"}
        assert per_thread(monitoring) == per_thread(trace)
    else:
        assert_stops(monitoring, trace)


@needs_monitoring
@pytest.mark.parametrize("name", sorted(DIFFERENTIAL_PROGRAMS))
def test_both_sources_stop_at_the_same_breakpoints(tmp_path, monkeypatch, name):
    program = textwrap.dedent(DIFFERENTIAL_PROGRAMS[name]).lstrip("\n")
    lines = len(program.splitlines())
    runs = {source: traced_with(tmp_path, monkeypatch, source, program, first="continue_run",
                                break_lines=range(1, lines + 1), record_threads=True)
            for source in ("settrace", "monitoring")}
    trace, monitoring = runs["settrace"].stops, runs["monitoring"].stops
    assert len(trace) > 3
    assert per_thread(monitoring) == per_thread(trace)


# ---- jumps --------------------------------------------------------------------------------------

JUMP_PROGRAM = """
    def work():
        value = 1
        value = value + 10
        value = value + 100
        return value

    def gen():
        n = yield 1
        n = (n or 0) + 1
        n = n + 1000
        yield n

    def loop():
        seen = []
        seen.append(len(seen))
        return seen

    print("value", work())
    g = gen()
    next(g)
    print("gen", g.send(5))
    print("loop", loop())
"""


@pytest.mark.parametrize("source", SOURCES)
def test_jump_in_the_stopped_frame(tmp_path, monkeypatch, source):
    """Setting f_lineno of the stopped frame from a line stop: forwards over a line, in a
    resumed generator, and backwards to run a line once more."""
    monkeypatch.setenv("SELVANE_EVENT_SOURCE", source)
    program = write_program_file(tmp_path, JUMP_PROGRAM)
    breaks = [[program, 3, 1, 0, None, 0], [program, 9, 1, 0, None, 0],
              [program, 16, 1, 0, None, 0]]
    commands = [["seq", ["exec", "frame.f_lineno = 4"], "step_into"],
                "continue_run",
                ["seq", ["exec", "frame.f_lineno = 10"], "step_into"],
                "continue_run",
                # Back to the append, which runs again and reaches the breakpoint again.
                ["seq", ["exec", "frame.f_lineno = 15"], "continue_run"]]
    run = ok(run_traced(tmp_path, program, first="continue_run", breaks=breaks,
                        commands=commands))
    assert_stops(run.stops, [("line", "prog.py", 3, "work"), ("line", "prog.py", 5, "work"),
                             ("line", "prog.py", 9, "gen"), ("line", "prog.py", 11, "gen"),
                             ("line", "prog.py", 16, "loop"), ("line", "prog.py", 16, "loop")])
    assert run.stdout == "value 101\ngen 1005\nloop [0, 1]\n"


@needs_monitoring
def test_jumps_agree_between_sources(tmp_path, monkeypatch):
    """Stepping into every line, jumping back once in work() and once in loop(): the stops
    after each jump are the same on both sources."""
    program = textwrap.dedent(JUMP_PROGRAM).lstrip("\n")
    jump_once = ("if (frame.f_code.co_name, frame.f_lineno) in {('work', 4): 3, ('loop', 16): 15}"
                 " and frame.f_code.co_name not in server.__dict__.setdefault('jumped', set()):\n"
                 "    server.jumped.add(frame.f_code.co_name)\n"
                 "    frame.f_lineno = {'work': 3, 'loop': 15}[frame.f_code.co_name]")
    runs = {source: ok(traced_with(tmp_path, monkeypatch, source, program,
                                   default=["seq", ["exec", jump_once], "step_into"]))
            for source in ("settrace", "monitoring")}
    assert runs["monitoring"].stdout == runs["settrace"].stdout
    assert runs["settrace"].stops.count(("line", "prog.py", 4, "work")) == 2
    assert runs["settrace"].stops.count(("line", "prog.py", 16, "loop")) == 2
    # Line 3 ran again after the jump back (11 + 10), and so did the append.
    assert runs["settrace"].stdout == "value 121\ngen 1006\nloop [0, 1]\n"
    assert_stops(runs["monitoring"].stops, runs["settrace"].stops)
