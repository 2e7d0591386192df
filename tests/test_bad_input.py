"""Every method of the core, called with a spread of wrong arguments, raises or answers,
never crashes, and leaves the core working: once with tracing off and once with the
calling threads traced. Run in a subprocess so that a crash is a failed test."""

import os
import subprocess
import sys

import pytest

import tvantrel30pydebugstackless as core

HERE = os.path.dirname(os.path.abspath(__file__))


@pytest.mark.parametrize("mode", [[], ["traced"]], ids=["untraced", "traced"])
def test_argument_storm_never_crashes(mode):
    proc = subprocess.run([sys.executable, os.path.join(HERE, "bad_input_driver.py")] + mode,
                          capture_output=True, text=True, timeout=300)
    assert proc.returncode == 0, proc.stderr[-3000:]
    assert proc.stdout.splitlines()[-1] == "core works"


def test_tracing_counter_cannot_become_negative():
    with pytest.raises(ValueError, match="tracing counter would become -1"):
        core.add_to_tstate_tracing(-1)
    assert core.get_tstate_tracing() == 0
    core.add_to_tstate_tracing(2)
    core.add_to_tstate_tracing(-2)  # negative values are fine while the counter stays >= 0
    assert core.get_tstate_tracing() == 0
