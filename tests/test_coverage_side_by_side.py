"""coverage.py and the core at the same time: `coverage run` of a program while the core
stops at a breakpoint in it reports the same executed and missing lines (and branches) as
`coverage run` of the program alone, whichever event source the core uses and whichever core
coverage uses, as long as the two do not need the same hook.

There is one hook they cannot share: the interpreter's trace function, one per thread. When
the core takes its events from the trace function and coverage measures with a trace function
too (its C tracer, the default up to 3.13, or COVERAGE_CORE=ctrace), whichever starts last
replaces the other: a core started after coverage leaves coverage blind from then on, and
coverage started after the core leaves the core blind. That case is stated by its own test
below. The way out is the other source on either side: the core under sys.monitoring
(SELVANE_EVENT_SOURCE=monitoring, 3.12+) keeps coverage's trace function, and coverage under
COVERAGE_CORE=sysmon holds its own tool id next to the core's.
"""

import json
import os
import subprocess
import sys

import pytest

from conftest import HERE, TIMEOUT

# coverage is one of the test venvs' tools (tools/lib.sh): without it these tests fail to
# import rather than skip.
import coverage  # noqa: F401

HAS_MONITORING = sys.version_info >= (3, 12)

PROGRAM = """
def classify(n):
    if n < 0:
        return "negative"
    if n == 0:
        return "zero"
    return "positive"


def unused():
    return 1


results = [classify(v) for v in (3, 0)]
print(results)
"""
BREAK_LINE = 4

# Inits the core with a line callback that records each stop and what holds the hooks at that
# moment, sets the breakpoint, starts tracing and runs the program as __main__. With
# "core-first" it starts coverage itself (API) after the core; otherwise `coverage run` has
# started coverage before this script.
DRIVER = """
import json
import runpy
import sys

import tvantrel30pydebugstackless as core
from core_args import init_args

program, out, order, data_file, branch = sys.argv[1:6]


def hooks():
    monitoring = getattr(sys, "monitoring", None)
    return {"trace": type(sys.gettrace()).__name__,
            "tools": [monitoring.get_tool(i) for i in range(6)] if monitoring else None}


stops = []


def line_cb(frame, changed):
    stops.append([frame.f_code.co_name, frame.f_lineno, hooks()])
    core.continue_run()


before = hooks()
core.init(*init_args(line_cb=line_cb))
core.set_break(program, BREAK_LINE, 1, 0, None, 0)
core.start_trace()
cov = None
if order == "core-first":
    import coverage
    cov = coverage.Coverage(data_file=data_file, branch=branch == "1")
    cov.start()
sys.argv = [program]
try:
    runpy.run_path(program, run_name="__main__")
finally:
    if cov is not None:
        cov.stop()
        cov.save()
    core.stop_trace()
    with open(out, "w") as f:
        json.dump({"before": before, "stops": stops}, f)
""".replace("BREAK_LINE", str(BREAK_LINE))


def run(args, tmp_path, env):
    try:
        proc = subprocess.run([sys.executable, *args], capture_output=True, text=True,
                              timeout=TIMEOUT, cwd=str(tmp_path), env=env)
    except subprocess.TimeoutExpired as hang:
        pytest.fail(f"{args} did not end within {TIMEOUT} s:\n{hang.stderr}")
    assert proc.returncode == 0, proc.stderr
    return proc


def coverage_env(coverage_core, event_source):
    env = dict(os.environ, PYTHONPATH=HERE)
    env.pop("COVERAGE_CORE", None)
    env.pop("SELVANE_EVENT_SOURCE", None)
    if coverage_core:
        env["COVERAGE_CORE"] = coverage_core
    if event_source:
        env["SELVANE_EVENT_SOURCE"] = event_source
    return env


def report(tmp_path, data_file, program, env):
    """The program's file in coverage's JSON report: executed and missing lines, and the
    executed and missing branches when measured; None when coverage recorded no data."""
    out = tmp_path / (os.path.basename(data_file) + ".json")
    proc = subprocess.run([sys.executable, "-m", "coverage", "json", "-q",
                           f"--data-file={data_file}", "-o", str(out), f"--include={program}"],
                          capture_output=True, text=True, timeout=TIMEOUT, cwd=str(tmp_path),
                          env=env)
    if proc.returncode != 0:
        assert "No data to report" in proc.stdout + proc.stderr, proc.stderr
        return None
    files = json.loads(out.read_text())["files"]
    assert list(files) == [os.path.basename(program)], files
    (entry,) = files.values()
    return {key: entry.get(key) for key in ("executed_lines", "missing_lines",
                                            "executed_branches", "missing_branches")}


def side_by_side(tmp_path, event_source, coverage_core, branch, order):
    """Runs the program under coverage alone, then under coverage and the core together;
    answers (report alone, report together, driver's record, outputs)."""
    program = tmp_path / "prog.py"
    program.write_text(PROGRAM.lstrip("\n"))
    driver = tmp_path / "driver.py"
    driver.write_text(DRIVER)
    env = coverage_env(coverage_core, event_source)
    branch_args = ["--branch"] if branch else []
    alone_data = str(tmp_path / ".coverage-alone")
    alone = run(["-m", "coverage", "run", *branch_args, f"--data-file={alone_data}",
                 str(program)], tmp_path, env)
    together_data = str(tmp_path / ".coverage-together")
    record = tmp_path / "record.json"
    driver_args = [str(driver), str(program), str(record), order, together_data,
                   "1" if branch else "0"]
    if order == "coverage-first":
        together = run(["-m", "coverage", "run", *branch_args, f"--data-file={together_data}",
                        *driver_args], tmp_path, env)
    else:
        together = run(driver_args, tmp_path, env)
    return (report(tmp_path, alone_data, str(program), env),
            report(tmp_path, together_data, str(program), env),
            json.loads(record.read_text()), alone.stdout, together.stdout)


PROBE = """
import json, sys
monitoring = getattr(sys, "monitoring", None)
print(json.dumps([type(sys.gettrace()).__name__,
                  monitoring is not None and monitoring.get_tool(1) == "coverage.py"]))
"""


def coverage_measures_with_trace_function(tmp_path, coverage_core, branch):
    """Which hook coverage itself chooses in this interpreter for these settings, asked of
    coverage alone (no core): its trace function, or its own sys.monitoring tool id."""
    probe = tmp_path / "probe.py"
    probe.write_text(PROBE)
    env = coverage_env(coverage_core, None)
    proc = run(["-m", "coverage", "run", *(["--branch"] if branch else []),
                f"--data-file={tmp_path / '.coverage-probe'}", str(probe)], tmp_path, env)
    tracer, tool = json.loads(proc.stdout.splitlines()[-1])
    assert (tracer == "CTracer") != tool, proc.stdout
    return tracer == "CTracer"


CORES = [None, "ctrace", "sysmon"]
SOURCES = ["settrace", pytest.param("monitoring", marks=pytest.mark.skipif(
    not HAS_MONITORING, reason="3.11 has no sys.monitoring: the trace function is its only "
                               "event source"))]


@pytest.mark.parametrize("order", ["coverage-first", "core-first"])
@pytest.mark.parametrize("branch", [False, True], ids=["lines", "branch"])
@pytest.mark.parametrize("coverage_core", CORES, ids=lambda c: f"coverage-{c or 'default'}")
@pytest.mark.parametrize("event_source", SOURCES)
def test_coverage_report_is_the_same_with_the_core_stopping(tmp_path, event_source,
                                                             coverage_core, branch, order):
    # COVERAGE_CORE=sysmon falls back to the C tracer where coverage cannot use
    # sys.monitoring (3.11; with --branch up to 3.13): ask coverage what it does here.
    coverage_tracer = coverage_measures_with_trace_function(tmp_path, coverage_core, branch)
    alone, together, record, alone_out, together_out = side_by_side(
        tmp_path, event_source, coverage_core, branch, order)
    # The program ran the same, and coverage alone measured it.
    assert together_out == alone_out == "['positive', 'zero']\n"
    assert alone is not None and 5 in alone["executed_lines"] and 3 in alone["missing_lines"]
    if branch:
        assert alone["executed_branches"], "branches should be measured with --branch"
    stops = record["stops"]
    if event_source == "settrace" and coverage_tracer:
        # Both want the thread's one trace function: the last to start replaces the other.
        if order == "coverage-first":
            # The core's start_trace replaced coverage's tracer: the core stops, coverage
            # measures nothing of the program.
            assert [s[:2] for s in stops] == [["classify", BREAK_LINE]] * 2
            assert all(s[2]["trace"] != "CTracer" for s in stops), stops
            assert together is None
        else:
            # Coverage's start replaced the core's trace function: coverage measures all,
            # the core never stops.
            assert stops == []
            assert together == alone
        return
    # Both tools were active: the core stopped twice at its breakpoint, and at each stop
    # coverage's hook was in place (its trace function, or its tool id next to the core's).
    assert [s[:2] for s in stops] == [["classify", BREAK_LINE]] * 2
    for _, _, hooks in stops:
        if coverage_tracer:
            assert hooks["trace"] == "CTracer", hooks
        else:
            assert hooks["tools"][1] == "coverage.py", hooks
        if event_source == "monitoring":
            assert hooks["tools"][0] == "selvane", hooks
    assert together == alone
