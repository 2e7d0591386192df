"""What one trace event costs in the debugger core, against the floor of a C trace function.

Usage: python run_bench.py [--iterations N] [--repeats R] [--only MODE,...] [--json]
                           [--event-source settrace|monitoring|both]
                           [--null-tracer-dir DIR] [--debugpy-python PYTHON]

Runs the workload of workload.py under each mode below, on the interpreter that runs this
script, and prints the best wall time of R repeats (time.perf_counter), the time per trace
event, and the ratio to the null C tracer. The modes run in rounds, one repeat of each mode
per round in a rotating order, so that a slow spell of the machine does not fall on one mode
only. The garbage collector is off while a repeat runs, as timeit does.

Modes:
  untraced        no trace function
  null-c          a C trace function that returns 0 at once (null_tracer/): the floor
  null-c-locked   the same, taking and releasing one thread lock per event
  core-free       the core installed and running freely (continue_run, no breakpoint): the
                  common case of a program under the debugger
  core-bp-elsewhere  the core running freely with one breakpoint in another file (this
                  one), on a line number that no line of the workload has: each line event
                  costs the lookup of its line number in a breakpoint table that is not empty
  core-bp-unreached  the core running freely with one breakpoint in the workload's own file,
                  on a line the workload never reaches (as the bdb mode has it)
  core-step-over  the core stepping over a call: stopped in a driver frame, the command is
                  step_over, and the driver then calls the workload, so every event of the
                  workload is one where the core must find that the stop frame is an outer
                  frame and answer "no stop"
  core-sublang-loaded  the core running freely with a sub-language hook registered and loaded
                  whose marker the workload never calls: each call event asks whether its
                  code is a marker
  core-sublang-active  the same with the workload called under the hook's marker, so the
                  sub-language is active: each event also asks whether its frame is a key
                  frame or one of the implementation's
  exc-untraced    the exception workload (workload.exc_workload: raising and catching in the
                  same frame and one frame out), no trace function
  exc-null-c      the exception workload under the null C tracer: its floor
  exc-core-never  the exception workload under the core running freely in exception mode 0
                  (never stop): exception events are recorded per frame, nothing analysed
  exc-core-unhandled
                  the same in exception mode 2 (stop on unhandled exceptions only): every
                  exception is analysed (handlers predicted from the byte code) and, all
                  being caught, none stops. The aim is within 2x of exc-core-never
  bdb             bdb.Bdb running freely with a breakpoint on a line the workload never
                  reaches, in the workload's own file (see _FreeRunningBdb)
  bdb-elsewhere   the same with the breakpoint in another file: bdb then traces no line of
                  the workload's frames at all; shown to make that shortcut visible, not to
                  compare like with like
  debugpy         debugpy (if --debugpy-python names an interpreter that has it) with a
                  client attached over loopback and a breakpoint on that unreached line; it
                  runs in a process of its own (see debugpy_child.py)
  gen-*           the generator workload (workload.gen_workload: yield from, and a coroutine
                  driven by send): gen-untraced, gen-null-c (its floor), gen-core-free,
                  gen-core-bp-unreached, gen-bdb, gen-debugpy
  thr-*           the two-thread workload (workload.thread_workload: two threads run the
                  workload at once, the time is the wall time of both): thr-untraced,
                  thr-null-c (the null tracer installed in each thread: its floor),
                  thr-core-free, thr-core-bp-unreached, thr-bdb (bdb's trace function given
                  to the new threads with threading.settrace), thr-debugpy

Event sources: every mode of the core (a name with "core" in it) runs once per event source
that --event-source selects (default "both" where the interpreter has sys.monitoring, else
settrace): SELVANE_EVENT_SOURCE is set before the core's init and restored after each run,
and the row is labelled "MODE [settrace]" or "MODE [monitoring]". The other modes do not
depend on the source and run once.

The number of events is counted once with a sys.settrace counter over one workload call, and
checked against what the counting variant of the null C tracer sees. The exc-*, gen-* and
thr-* modes run their own workload: their events are counted on it (thr-*: in both threads,
with threading.settrace), and their floor is their own null-c mode.

With --json the results also go to results-<python version>.json beside this script: "modes"
is keyed by the row label, and each row names its "mode" and "event_source" (null for the
modes that do not depend on it).
"""

import argparse
import gc
import json
import os
import platform
import statistics
import subprocess
import sys
import threading
import time

HERE = os.path.dirname(os.path.abspath(__file__))
ROOT = os.path.dirname(HERE)
sys.path.insert(0, HERE)

import workload as wl  # noqa: E402

perf_counter = time.perf_counter
# The interpreter's own import function: init replaces the builtins' __import__ with the
# core's hook, and a later init must be given the original, not the hook.
_ORIGINAL_IMPORT = __import__
VERSION = platform.python_version()


class Skip(Exception):
    """A mode that cannot run here; its message says why."""


class Failed(Exception):
    """A mode that ran but did not behave as the benchmark assumes."""


# ---- timing ---------------------------------------------------------------------------------


def timed(n, work=None):
    work = work or wl.workload
    # One line, so that a tracer sees one line event here, before t0 is taken, and none
    # between the workload's return and t1: a debugger that stops on this frame's lines
    # (core-step-over) stops outside the measured span.
    t0 = perf_counter(); work(n); t1 = perf_counter()  # noqa: E702
    return t1 - t0


def use_callgrind_clock():
    """Makes timed() switch callgrind's collection on and off around the workload."""
    global perf_counter
    perf_counter = _null_tracer().callgrind_clock
    # Collection is per thread: the two-thread workload's threads switch it themselves.
    wl.thread_span = perf_counter


def never_reached_line(function):
    """The last line of a function that nothing calls: where a breakpoint is never hit."""
    return max(line for _, _, line in function.__code__.co_lines() if line is not None)


def _never_called_here():
    # bdb-elsewhere puts its breakpoint here, in this file, away from the workload's file.
    return None


# ---- modes ----------------------------------------------------------------------------------


def mode_untraced(n):
    return timed(n)


def _null_tracer():
    try:
        import _null_tracer
    except ImportError as exc:
        raise Skip(f"_null_tracer is not built for {VERSION} ({exc}); see null_tracer/build.py")
    return _null_tracer


def mode_null(n):
    tracer = _null_tracer()
    tracer.install()
    try:
        return timed(n)
    finally:
        tracer.uninstall()


def mode_null_locked(n):
    tracer = _null_tracer()
    tracer.install_locked()
    try:
        return timed(n)
    finally:
        tracer.uninstall()


def _core():
    try:
        import tvantrel30pydebugstackless as core
    except ImportError as exc:
        raise Skip(f"the core is not installed in this interpreter ({exc})")
    return core


def _noop(*args):
    return None


class _CallbackCounter:
    """Callbacks that must not be called: the core running freely never stops."""

    def __init__(self):
        self.calls = {"line": 0, "return": 0, "exception": 0}

    def line(self, frame, changed):
        self.calls["line"] += 1

    def ret(self, frame, value, changed):
        self.calls["return"] += 1

    def exc(self, frame, exc_info, changed):
        self.calls["exception"] += 1


def _init_core(core, line_cb, return_cb, exception_cb):
    def install_thread_hooks(flag):
        # What the server side does (selvane/session.py): threads started while the core
        # traces are bootstrapped by it (needed by the trace-function source; sys.monitoring
        # sees every thread anyway).
        threading._trace_hook = core.bootstrap_new_thread if flag else None

    core.init(0.0, 0, install_thread_hooks, _noop, line_cb, return_cb, exception_cb, _noop,
              None, _ORIGINAL_IMPORT, None, {})


def _check_core_installed():
    source = os.environ.get("SELVANE_EVENT_SOURCE") or (
        "monitoring" if hasattr(sys, "monitoring") else "settrace")
    if source == "monitoring":
        if sys.monitoring.get_tool(sys.monitoring.DEBUGGER_ID) != "selvane":
            raise Failed("start_trace() did not take the sys.monitoring debugger tool id")
    elif sys.gettrace() is None:
        raise Failed("start_trace() left the thread without a trace function")


def mode_core_free(n, work=None, exception_mode=0):
    core = _core()
    counter = _CallbackCounter()
    _init_core(core, counter.line, counter.ret, counter.exc)
    core.set_exception_mode(exception_mode)
    core.continue_run()
    core.start_trace()
    try:
        _check_core_installed()
        elapsed = timed(n, work)
    finally:
        core.stop_trace()
        core.reset()
    if any(counter.calls.values()):
        raise Failed(f"the core stopped while running freely: callbacks {counter.calls}")
    return elapsed


def mode_exc_untraced(n):
    return timed(n, wl.exc_workload)


def mode_exc_null(n):
    tracer = _null_tracer()
    tracer.install()
    try:
        return timed(n, wl.exc_workload)
    finally:
        tracer.uninstall()


def mode_exc_core_never(n):
    return mode_core_free(n, wl.exc_workload, exception_mode=0)


def mode_exc_core_unhandled(n):
    return mode_core_free(n, wl.exc_workload, exception_mode=2)


def _run_core_with_breakpoint(n, filename, line, work=None):
    core = _core()
    counter = _CallbackCounter()
    _init_core(core, counter.line, counter.ret, counter.exc)
    core.set_break(filename, line, 1, 0, None, 0)
    core.continue_run()
    core.start_trace()
    try:
        _check_core_installed()
        elapsed = timed(n, work)
    finally:
        core.stop_trace()
        core.reset()
    if any(counter.calls.values()):
        raise Failed(f"the core stopped at an unreached breakpoint: callbacks {counter.calls}")
    return elapsed


def _workload_lines():
    lines = set()
    for function in (wl.leaf, wl.workload):
        lines.update(line for _, _, line in function.__code__.co_lines() if line is not None)
    return lines


def mode_core_bp_elsewhere(n):
    line = never_reached_line(_never_called_here)
    if line in _workload_lines():
        raise Failed(f"line {line} of this file is also a line of the workload")
    return _run_core_with_breakpoint(n, __file__, line)


def mode_core_bp_unreached(n, work=None):
    return _run_core_with_breakpoint(n, wl.__file__, never_reached_line(wl.never_called), work)


class _BenchHook:
    """A loaded sub-language hook whose marker, key frame and files the workload never
    touches: what every call event pays once a sub-language is registered."""

    def __init__(self, marker, key):
        self.marker, self.key = marker, key

    def _GetMarkerFrames(self):
        return [self.marker.__code__]

    def _GetModulePaths(self):
        return [(os.path.join(os.path.dirname(os.path.abspath(__file__)), "no-such-engine"), 1)]

    def _GetSubLanguageFrames(self):
        return [self.key.__code__]

    def _StopHere(self, frame, event, action):
        return False

    def _TranslateFrame(self, frame, flag):
        return ("<template>", 1)

    def _Eval(self, condition, frame):
        return False


def _marker(n, work):
    return timed(n, work)


def _run_core_with_sub_language(n, active):
    core = _core()
    counter = _CallbackCounter()
    _init_core(core, counter.line, counter.ret, counter.exc)
    core.register_sub_language_hook(_BenchHook(_marker, _never_called_here))
    core.continue_run()
    core.start_trace()
    try:
        _check_core_installed()
        # Under the marker every event of the workload asks whether it is a key frame or a
        # frame of the implementation.
        elapsed = _marker(n, None) if active else timed(n)
    finally:
        core.stop_trace()
        core.reset()
    if any(counter.calls.values()):
        raise Failed(f"the core stopped under an idle sub-language: callbacks {counter.calls}")
    return elapsed


def mode_core_sublang_loaded(n):
    return _run_core_with_sub_language(n, active=False)


def mode_core_sublang_active(n):
    return _run_core_with_sub_language(n, active=True)


def _stepped_driver(n):
    elapsed = None  # the first stop in this frame: the line callback answers step_over
    elapsed = timed(n)  # stops here again, and steps over the call
    return elapsed  # stops here once the workload is done, and continues


class _Stepper:
    """Steps into _stepped_driver, then over the call that runs the workload.

    Stops before the driver are answered with step_into until the driver's first line. There
    and at the next line the answer is step_over: stop_frame is the driver's frame, and every
    event of the call that follows (timed() and the workload under it) is one where the core
    walks from the event's frame outward, meets the stop frame and does not stop. The next
    stop is the driver's last line, once the workload has returned; it is answered with
    continue_run.
    """

    def __init__(self, core):
        self.core = core
        self.code = _stepped_driver.__code__
        self.driver_stops = []  # (event, line relative to the def line)
        self.other_stops = 0

    def _stop(self, event, frame):
        if frame.f_code is not self.code:
            self.other_stops += 1
            self.core.step_into()
            return
        line = frame.f_lineno - self.code.co_firstlineno
        self.driver_stops.append((event, line))
        if line < 3:
            self.core.step_over()
        else:
            self.core.continue_run()

    def line(self, frame, changed):
        self._stop("line", frame)

    def ret(self, frame, value, changed):
        self._stop("return", frame)

    def exc(self, frame, exc_info, changed):
        self._stop("exception", frame)


def mode_core_step_over(n):
    core = _core()
    stepper = _Stepper(core)
    _init_core(core, stepper.line, stepper.ret, stepper.exc)
    core.step_into()
    core.start_trace()
    try:
        _check_core_installed()
        elapsed = _stepped_driver(n)
    finally:
        core.stop_trace()
        core.reset()
    if stepper.driver_stops != [("line", 1), ("line", 2), ("line", 3)]:
        raise Failed(f"unexpected stops in the driver: {stepper.driver_stops}")
    return elapsed


def _bdb_class():
    import bdb

    class _FreeRunningBdb(bdb.Bdb):
        """bdb running freely, the nearest thing to the core's continue_run.

        Bdb.set_continue() removes the trace function when no breakpoint exists, so with no
        breakpoint bdb costs nothing at all. A debugger session with one breakpoint set,
        somewhere the program does not reach, is the fair equivalent of the core running
        freely: bdb keeps tracing, and since the breakpoint's file is the workload's file it
        traces every line of the workload's frames (stop_here compares the frame with the
        stop frame, break_here looks the line up in the file's breakpoints). The one stop, at the first line of the traced call
        and before the timer starts, is answered with set_continue().
        """

        def __init__(self):
            super().__init__()
            self.stops = 0

        def _continue(self):
            self.stops += 1
            self.set_continue()

        def user_call(self, frame, argument_list):
            # Bdb calls this at every call in a file with a breakpoint and leaves the
            # decision to the subclass, as pdb does it: stop only where stop_here() says so.
            if self.stop_here(frame):
                self._continue()

        def user_line(self, frame):
            self._continue()

        def user_return(self, frame, return_value):
            self._continue()

        def user_exception(self, frame, exc_info):
            self._continue()

    return _FreeRunningBdb


def _run_bdb(n, filename, line, work=None, threads=False):
    debugger = _bdb_class()()
    error = debugger.set_break(filename, line)
    if error:
        raise Failed(f"bdb refused the breakpoint: {error}")
    if threads:
        # bdb traces the thread it runs in; the workload's threads get its trace function
        # as pdb users give it to them, with threading.settrace.
        threading.settrace(debugger.trace_dispatch)
    try:
        elapsed = debugger.runcall(timed, n, work)
    finally:
        threading.settrace(None)
        # Breakpoints are global to the Bdb class: a new instance loads those of the old
        # ones, and the next run must see only its own.
        debugger.clear_all_breaks()
    if debugger.stops != 1:
        raise Failed(f"bdb stopped {debugger.stops} times, expected once")
    return elapsed


def mode_bdb(n, work=None, threads=False):
    return _run_bdb(n, wl.__file__, never_reached_line(wl.never_called), work, threads)


def mode_bdb_elsewhere(n):
    return _run_bdb(n, __file__, never_reached_line(_never_called_here))


# ---- the generator and two-thread workloads --------------------------------------------------


def _null_in_each_thread(work, n):
    tracer = _null_tracer()
    tracer.install()
    try:
        work(n)
    finally:
        tracer.uninstall()


def _threads_under_null(n):
    wl.thread_workload(n, per_thread=_null_in_each_thread)


def mode_gen_untraced(n):
    return timed(n, wl.gen_workload)


def mode_gen_null(n):
    tracer = _null_tracer()
    tracer.install()
    try:
        return timed(n, wl.gen_workload)
    finally:
        tracer.uninstall()


def mode_thr_untraced(n):
    return timed(n, wl.thread_workload)


def mode_thr_null(n):
    _null_tracer()
    return timed(n, _threads_under_null)


MODES = {
    "untraced": mode_untraced,
    "null-c": mode_null,
    "null-c-locked": mode_null_locked,
    "core-free": mode_core_free,
    "core-bp-elsewhere": mode_core_bp_elsewhere,
    "core-bp-unreached": mode_core_bp_unreached,
    "core-step-over": mode_core_step_over,
    "core-sublang-loaded": mode_core_sublang_loaded,
    "core-sublang-active": mode_core_sublang_active,
    "exc-untraced": mode_exc_untraced,
    "exc-null-c": mode_exc_null,
    "exc-core-never": mode_exc_core_never,
    "exc-core-unhandled": mode_exc_core_unhandled,
    "bdb": mode_bdb,
    "bdb-elsewhere": mode_bdb_elsewhere,
    "gen-untraced": mode_gen_untraced,
    "gen-null-c": mode_gen_null,
    "gen-core-free": lambda n: mode_core_free(n, wl.gen_workload),
    "gen-core-bp-unreached": lambda n: mode_core_bp_unreached(n, wl.gen_workload),
    "gen-bdb": lambda n: mode_bdb(n, wl.gen_workload),
    "thr-untraced": mode_thr_untraced,
    "thr-null-c": mode_thr_null,
    "thr-core-free": lambda n: mode_core_free(n, wl.thread_workload),
    "thr-core-bp-unreached": lambda n: mode_core_bp_unreached(n, wl.thread_workload),
    "thr-bdb": lambda n: mode_bdb(n, wl.thread_workload, threads=True),
    # debugpy runs in a process of its own: see measure_debugpy().
}
DEBUGPY_MODES = {"debugpy": "main", "gen-debugpy": "gen", "thr-debugpy": "thr"}
FLOOR = "null-c"
# The modes that run the exception workload, and their floor.
EXC_MODES = ("exc-untraced", "exc-null-c", "exc-core-never", "exc-core-unhandled")
EXC_FLOOR = "exc-null-c"
# Each workload by the prefix of its modes' names.
WORKLOADS = {"main": wl.workload, "exc": wl.exc_workload, "gen": wl.gen_workload,
             "thr": wl.thread_workload}
SOURCES = ("settrace", "monitoring")


def workload_of(mode):
    """The workload a mode (or a row label) runs: "main", "exc", "gen" or "thr"."""
    prefix = mode.split("-", 1)[0]
    return prefix if prefix in WORKLOADS else "main"


def floor_of(mode):
    kind = workload_of(mode)
    return FLOOR if kind == "main" else f"{kind}-null-c"


def untraced_of(mode):
    kind = workload_of(mode)
    return "untraced" if kind == "main" else f"{kind}-untraced"


def is_core_mode(mode):
    """Whether a mode runs the core, and so depends on the event source."""
    return "core" in mode.split("-")


def available_sources():
    return SOURCES if hasattr(sys, "monitoring") else ("settrace",)


def label(mode, source):
    return f"{mode} [{source}]" if source else mode


def runs_of(modes, sources):
    """(mode, source) pairs: a core mode once per source, the others once with None."""
    return [(mode, source) for mode in modes
            for source in (sources if is_core_mode(mode) else (None,))]


# ---- event count ----------------------------------------------------------------------------


def count_events(n, work=None):
    """The events of one workload(n) call, by kind, as sys.settrace sees them."""
    counts = {}
    lock = threading.Lock()

    def trace(frame, event, arg):
        with lock:  # the two-thread workload's threads count into one table
            counts[event] = counts.get(event, 0) + 1
        return trace

    threading.settrace(trace)
    sys.settrace(trace)
    try:
        (work or wl.workload)(n)
    finally:
        sys.settrace(None)
        threading.settrace(None)
    return counts


def count_events_in_c(n):
    """What the counting null tracer sees over a timed() call: the workload's events plus the
    few of timed() itself."""
    try:
        tracer = _null_tracer()
    except Skip:
        return None
    tracer.install_counting()
    try:
        timed(n)
    finally:
        tracer.uninstall()
    return tracer.counts()


# ---- debugpy, in its own process ------------------------------------------------------------


def measure_debugpy(python, iterations, repeats, workloads=("main",)):
    """Runs debugpy_child.py under `python` (an interpreter that has debugpy); returns
    {workload: list of times}, a note on how debugpy traced and {workload: list of times}
    of the same workloads untraced in debugpy's process, or raises Skip."""
    if not python:
        raise Skip("no --debugpy-python given")
    command = [python, os.path.join(HERE, "debugpy_child.py"), str(iterations), str(repeats),
               ",".join(workloads)]
    # The check it skips warns about breakpoints in frozen standard modules, on stderr.
    env = dict(os.environ, PYDEVD_DISABLE_FILE_VALIDATION="1")
    try:
        done = subprocess.run(command, capture_output=True, text=True, timeout=600, env=env)
    except (OSError, subprocess.TimeoutExpired) as exc:
        raise Skip(f"debugpy run failed: {exc}")
    if done.returncode != 0:
        tail = (done.stderr.strip().splitlines() or ["(no output)"])[-1]
        raise Skip(f"debugpy run failed: {tail}")
    result = json.loads(done.stdout.strip().splitlines()[-1])
    if "skip" in result:
        raise Skip(result["skip"])
    times = result.get("times_by_workload") or {"main": result["times"]}
    untraced = result.get("untraced_times_by_workload", {})
    return times, f"debugpy {result['debugpy']} traced through {result['tracer']}", untraced


# ---- driver ---------------------------------------------------------------------------------


def run_once(mode, n, source=None):
    """One run of a mode; a core mode under `source` (SELVANE_EVENT_SOURCE, read by the
    core's init, is set for the run and restored after it)."""
    saved = os.environ.get("SELVANE_EVENT_SOURCE")
    if source:
        os.environ["SELVANE_EVENT_SOURCE"] = source
    gc.collect()
    gc.disable()
    try:
        return MODES[mode](n)
    finally:
        gc.enable()
        if saved is None:
            os.environ.pop("SELVANE_EVENT_SOURCE", None)
        else:
            os.environ["SELVANE_EVENT_SOURCE"] = saved


def run_once_timed(n, work=None):
    """One timed() run on the same terms as run_once(), for a tracer installed by the caller
    (debugpy_child.py)."""
    gc.collect()
    gc.disable()
    try:
        return timed(n, work)
    finally:
        gc.enable()


def measure(runs, iterations, repeats):
    """Times each (mode, source) run `repeats` times in rotating rounds, after one warm-up
    run each. Returns {label: list of seconds} and {label: reason} for the runs that were
    skipped."""
    times = {label(*run): [] for run in runs}
    skipped = {}
    for run in runs:  # warm-up: first-run costs (imports, instrumenting code) stay out
        try:
            run_once(run[0], iterations, run[1])
        except Skip as exc:
            skipped[label(*run)] = str(exc)
    active = [run for run in runs if label(*run) not in skipped]
    for round_number in range(repeats):
        shift = round_number % len(active) if active else 0
        for run in active[shift:] + active[:shift]:
            times[label(*run)].append(run_once(run[0], iterations, run[1]))
    return {label(*run): times[label(*run)] for run in active}, skipped


def mode_and_source(row_label):
    mode, _, rest = row_label.partition(" [")
    return mode, (rest.rstrip("]") or None)


def summarise(times, events_by_workload):
    rows = {}
    for row_label, values in times.items():
        mode, source = mode_and_source(row_label)
        floor = min(times[floor_of(mode)]) if floor_of(mode) in times else None
        untraced = min(times[untraced_of(mode)]) if untraced_of(mode) in times else None
        n_events = events_by_workload[workload_of(mode)]
        best = min(values)
        rows[row_label] = {
            "mode": mode,
            "event_source": source,
            "workload": workload_of(mode),
            "best_s": best,
            "median_s": statistics.median(values),
            "ns_per_event": best / n_events * 1e9,
            "ns_per_event_above_floor": (best - floor) / n_events * 1e9 if floor else None,
            "ratio_to_floor": best / floor if floor else None,
            "ratio_to_untraced": best / untraced if untraced else None,
            "times_s": values,
        }
    return rows


def print_table(rows, skipped, events, counts, c_counts, iterations, repeats):
    kinds = ", ".join(f"{kind} {count}" for kind, count in sorted(counts.items()))
    print(f"CPython {VERSION} ({platform.machine()}), {iterations} iterations, "
          f"{events} events per run ({kinds}), best of {repeats}")
    if c_counts is not None:
        seen = sum(c_counts.values())
        print(f"  the counting C tracer saw {seen} events over the timed span "
              f"({seen - events:+d}: the timing line's own events)")
    header = (f"{'mode':<36}{'best s':>10}{'median s':>10}{'ns/event':>10}"
              f"{'+ns over null':>15}{'x null':>8}{'x untraced':>12}")
    print(header)
    print("-" * len(header))
    for row_label, row in rows.items():
        above = row["ns_per_event_above_floor"]
        ratio = row["ratio_to_floor"]
        ratio_u = row["ratio_to_untraced"]
        print(f"{row_label:<36}{row['best_s']:>10.4f}{row['median_s']:>10.4f}"
              f"{row['ns_per_event']:>10.1f}"
              f"{(f'{above:+.1f}' if above is not None else '-'):>15}"
              f"{(f'{ratio:.2f}' if ratio is not None else '-'):>8}"
              f"{(f'{ratio_u:.2f}' if ratio_u is not None else '-'):>12}")
    for row_label, reason in skipped.items():
        print(f"{row_label:<36}skipped: {reason}")


def targets(rows, debugpy_untraced=None):
    """The issue's targets that this run's rows can tell: (what, figure, met or None).
    debugpy_untraced: {debugpy mode: best time of its workload untraced in debugpy's own
    process}; with it, each debugpy comparison is also made as the two slowdowns, each over
    its own process's untraced time."""
    found = []
    debugpy_untraced = debugpy_untraced or {}

    def best(row_label):
        return rows[row_label]["best_s"] if row_label in rows else None

    for mode in ("core-bp-elsewhere", "core-bp-unreached", "core-free"):
        value = rows.get(label(mode, "monitoring"), {}).get("ratio_to_untraced")
        if value is not None:
            found.append((f"{mode} [monitoring] within 1.05x of untraced", f"{value:.3f}x",
                          value <= 1.05))
    for debugpy_mode in DEBUGPY_MODES:
        theirs = best(debugpy_mode)
        if theirs is None:
            continue
        kind = workload_of(debugpy_mode)
        prefix = "" if kind == "main" else f"{kind}-"
        # The target is for sys.monitoring where the interpreter has it (3.11: settrace).
        for source in (("monitoring",) if hasattr(sys, "monitoring") else ("settrace",)):
            ours = best(label(f"{prefix}core-bp-unreached", source))
            if ours is not None:
                found.append((f"{prefix}core-bp-unreached [{source}] at least as fast as "
                              f"{debugpy_mode}", f"{ours / theirs:.2f}x debugpy's time",
                              ours <= theirs))
            ours_untraced = best(untraced_of(f"{prefix}core-bp-unreached"))
            theirs_untraced = debugpy_untraced.get(debugpy_mode)
            if ours is not None and ours_untraced and theirs_untraced:
                slow_ours, slow_theirs = ours / ours_untraced, theirs / theirs_untraced
                found.append(("  the same, each over its own process's untraced time",
                              f"{slow_ours:.3f}x against debugpy's {slow_theirs:.3f}x",
                              slow_ours <= slow_theirs))
    step_trace, step_mon = best(label("core-step-over", "settrace")), best(
        label("core-step-over", "monitoring"))
    if step_trace and step_mon:
        found.append(("core-step-over [monitoring] no slower than [settrace]",
                      f"{step_mon / step_trace:.2f}x", step_mon <= step_trace))
    return found


def main(argv=None):
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument("--iterations", type=int, default=50_000,
                        help="loop iterations of the workload (6 events each)")
    parser.add_argument("--repeats", type=int, default=7, help="timed runs per mode")
    parser.add_argument("--only", default="",
                        help="comma-separated modes to run (default: all)")
    parser.add_argument("--event-source", default="both",
                        choices=("settrace", "monitoring", "both"),
                        help="event sources of the core modes (default: both where the "
                             "interpreter has sys.monitoring)")
    parser.add_argument("--json", action="store_true",
                        help=f"also write results-{VERSION}.json beside this script")
    parser.add_argument("--null-tracer-dir",
                        default=os.path.join(ROOT, "build", f"bench-null-tracer-{VERSION}"),
                        help="folder that holds the built _null_tracer extension")
    parser.add_argument("--debugpy-python", default="",
                        help="interpreter (same version) that has debugpy installed")
    parser.add_argument("--under-callgrind", action="store_true",
                        help="(used by count_instructions.py) let callgrind collect only "
                             "the timed spans")
    args = parser.parse_args(argv)

    sys.path.insert(0, args.null_tracer_dir)
    known = list(MODES) + list(DEBUGPY_MODES)
    wanted = [m for m in args.only.split(",") if m] or known
    unknown = [m for m in wanted if m not in known]
    if unknown:
        parser.error(f"unknown modes {unknown}; known: {known}")
    sources = available_sources() if args.event_source == "both" else (args.event_source,)
    if "monitoring" in sources and not hasattr(sys, "monitoring"):
        parser.error(f"CPython {VERSION} has no sys.monitoring")

    kinds_wanted = {workload_of(m) for m in wanted} | {"main"}
    counts_by_workload = {kind: count_events(args.iterations, WORKLOADS[kind])
                          for kind in WORKLOADS if kind in kinds_wanted}
    events_by_workload = {kind: sum(c.values()) for kind, c in counts_by_workload.items()}
    counts, events = counts_by_workload["main"], events_by_workload["main"]
    c_counts = None if args.under_callgrind else count_events_in_c(args.iterations)
    if args.under_callgrind:
        use_callgrind_clock()
    if c_counts is not None and not 0 <= sum(c_counts.values()) - events <= 8:
        print(f"warning: the C tracer saw {c_counts}, sys.settrace saw {counts}",
              file=sys.stderr)

    try:
        times, skipped = measure(runs_of([m for m in wanted if m in MODES], sources),
                                 args.iterations, args.repeats)
    except Failed as exc:
        print(f"error: {exc}", file=sys.stderr)
        return 1
    notes = {}
    debugpy_wanted = [m for m in wanted if m in DEBUGPY_MODES]
    debugpy_untraced = {}
    if debugpy_wanted and not args.under_callgrind:
        try:
            by_workload, notes["debugpy"], untraced_there = measure_debugpy(
                args.debugpy_python, args.iterations, args.repeats,
                [DEBUGPY_MODES[m] for m in debugpy_wanted])
            for mode in debugpy_wanted:
                times[mode] = by_workload[DEBUGPY_MODES[mode]]
                if untraced_there.get(DEBUGPY_MODES[mode]):
                    debugpy_untraced[mode] = min(untraced_there[DEBUGPY_MODES[mode]])
        except Skip as exc:
            for mode in debugpy_wanted:
                skipped[mode] = str(exc)
    rows = summarise(times, events_by_workload)
    print_table(rows, skipped, events, counts, c_counts, args.iterations, args.repeats)
    print(f"event sources of the core modes: {', '.join(sources)}")
    for kind, kind_counts in counts_by_workload.items():
        if kind == "main":
            continue
        kinds = ", ".join(f"{k} {c}" for k, c in sorted(kind_counts.items()))
        print(f"{kind}-* modes: workload.{WORKLOADS[kind].__name__}, "
              f"{events_by_workload[kind]} events per run ({kinds}); their floor is "
              f"{kind}-null-c")
    for source in sources:
        never = rows.get(label("exc-core-never", source))
        unhandled = rows.get(label("exc-core-unhandled", source))
        if never and unhandled:
            ratio = unhandled["best_s"] / never["best_s"]
            unhandled["ratio_to_exc_core_never"] = ratio
            print(f"exc-core-unhandled / exc-core-never [{source}]: {ratio:.2f} "
                  "(aim: at most 2)")
    for mode, note in notes.items():
        print(f"{mode}: {note}")
    for mode, value in debugpy_untraced.items():
        per_event = value / events_by_workload[workload_of(mode)] * 1e9
        rows[mode]["untraced_in_own_process_ns_per_event"] = per_event
        print(f"{mode}: the workload untraced in debugpy's process, before debugpy starts: "
              f"{per_event:.1f} ns/event ({rows[mode]['best_s'] / value:.3f}x under debugpy)")
    found = targets(rows, debugpy_untraced)
    if found:
        print("targets (wall time, best of the repeats):")
        for what, figure, met in found:
            print(f"  {'met   ' if met else 'missed'}  {what}: {figure}")

    if args.json:
        path = os.path.join(HERE, f"results-{VERSION}.json")
        with open(path, "w") as f:
            json.dump({
                "python": VERSION,
                "implementation": platform.python_implementation(),
                "machine": platform.machine(),
                "cpus": os.cpu_count(),
                "iterations": args.iterations,
                "repeats": args.repeats,
                "event_sources": list(sources),
                "events_per_run": events,
                "events_by_kind": counts,
                "exc_events_per_run": events_by_workload.get("exc", 0),
                "exc_events_by_kind": counts_by_workload.get("exc", {}),
                "events_per_run_by_workload": events_by_workload,
                "floor": FLOOR,
                "modes": rows,
                "skipped": skipped,
                "notes": notes,
                "targets": [{"what": w, "figure": fig, "met": met} for w, fig, met in found],
            }, f, indent=2)
            f.write("\n")
        print(f"wrote {path}")
    return 0


if __name__ == "__main__":
    sys.exit(main())
