"""Shared helpers of the behaviour tests.

Programs are traced in a subprocess by scripted_server.py, so that a crash or a hang of the
core is a failed test, not a dead test run. Expected-sequence tests compare the list of
stops with an expected list and show the difference; set TRACE_DRY_RUN=1 to print the
actual lists instead, which makes writing expectations easy.
"""

import json
import os
import subprocess
import sys
import textwrap
from dataclasses import dataclass, field

import pytest

HERE = os.path.dirname(os.path.abspath(__file__))
SERVER = os.path.join(HERE, "scripted_server.py")
RECORDER = os.path.join(HERE, "line_recorder.py")
TIMEOUT = 120
# The event source the core takes its events from in this run (the suite runs on both):
# sys.monitoring where the interpreter has it, unless SELVANE_EVENT_SOURCE says otherwise.
MONITORING = (os.environ.get("SELVANE_EVENT_SOURCE") or
              ("monitoring" if hasattr(sys, "monitoring") else "settrace")) == "monitoring"


@dataclass
class Run:
    returncode: int
    stdout: str
    stderr: str
    stops: list = field(default_factory=list)
    events: list = field(default_factory=list)
    threads_after: int = -1
    tracing_after_stop: int = -1
    after_stop: object = None
    stop_count: int = 0
    break_ids: list = field(default_factory=list)


def write_program(tmp_path, source, name="prog.py"):
    path = tmp_path / name
    path.write_text(textwrap.dedent(source).lstrip("\n"))
    return str(path)


def run_traced(tmp_path, program, timeout=TIMEOUT, **config):
    """Traces `program` (a path, or source text) under the scripted server side. A run that
    takes longer than `timeout` seconds fails the test (a hang is a failure, not a stall)."""
    if "\n" in program:
        program = write_program(tmp_path, program)
    out = tmp_path / "stops.json"
    if out.exists():
        out.unlink()
    config = dict(config, program=program, out=str(out))
    config_path = tmp_path / "config.json"
    config_path.write_text(json.dumps(config))
    try:
        proc = subprocess.run([sys.executable, SERVER, str(config_path)], capture_output=True,
                              text=True, timeout=timeout, cwd=str(tmp_path))
    except subprocess.TimeoutExpired as hang:
        pytest.fail(f"traced run did not end within {timeout} s:\n{hang.stderr}")
    run = Run(proc.returncode, proc.stdout, proc.stderr)
    if out.exists():
        data = json.loads(out.read_text())
        run.stops = [tuple(s) for s in data["stops"]]
        run.events = data["events"]
        run.threads_after = data["threads_after"]
        run.tracing_after_stop = data["tracing_after_stop"]
        run.after_stop = data.get("after_stop")
        run.stop_count = data.get("stop_count", 0)
        run.break_ids = data.get("break_ids", [])
    elif proc.returncode < 0 or "Fatal Python error" in proc.stderr:
        pytest.fail(f"traced run crashed ({proc.returncode}):\n{proc.stderr}")
    return run


def run_plain(tmp_path, program):
    """Runs `program` without any debugger, for comparing output and exit status."""
    if "\n" in program:
        program = write_program(tmp_path, program)
    return subprocess.run([sys.executable, program], capture_output=True, text=True,
                          timeout=TIMEOUT, cwd=str(tmp_path))


def record_lines(tmp_path, program):
    """The line events a plain sys.settrace function sees for `program`, as the core would
    report them: (file base name, line, function)."""
    out = tmp_path / "lines.json"
    subprocess.run([sys.executable, RECORDER, program, str(out)], capture_output=True,
                   text=True, timeout=TIMEOUT, cwd=str(tmp_path), check=True)
    return [tuple(x) for x in json.loads(out.read_text())]


def assert_stops(actual, expected):
    actual = [tuple(s) for s in actual]
    expected = [tuple(s) for s in expected]
    if os.environ.get("TRACE_DRY_RUN"):
        print("\nactual stops:")
        for stop in actual:
            print(f"    {stop!r},")
    if actual != expected:
        import difflib
        diff = "\n".join(difflib.unified_diff([repr(s) for s in expected],
                                              [repr(s) for s in actual], "expected", "actual",
                                              lineterm=""))
        pytest.fail(f"stop sequence differs:\n{diff}")


def ok(run):
    """Asserts that a traced run ended normally and returns it."""
    assert run.returncode == 0, run.stderr
    return run
