"""The exception prediction offered to the server side: analysis.predict_catch for each kind
of answer, its refusal of bad arguments, and that it never runs the program's own code (a
__getattr__, a property, an __exit__ that blocks). The questions are asked in a subprocess
(predict_catch_probe.py) with a timeout, so a crash or a hang fails the test."""

import json
import os
import subprocess
import sys

import pytest

PROBE = os.path.join(os.path.dirname(os.path.abspath(__file__)), "predict_catch_probe.py")


@pytest.fixture(scope="module")
def answers():
    proc = subprocess.run([sys.executable, PROBE], capture_output=True, text=True, timeout=60)
    assert proc.returncode == 0, proc.stderr
    data = json.loads(proc.stdout)
    return data["results"], data["markers"]


PY = "predict_catch_probe.py"


def test_an_except_clause_that_catches_is_named_with_its_line(answers):
    results, lines = answers
    assert results["caught"] == ["caught", "caught", PY, lines["caught"]]
    assert results["caught_by_class"] == ["caught", "caught_by_class", PY,
                                          lines["caught_by_class"]]


def test_nothing_catching_is_uncaught(answers):
    results, _ = answers
    assert results["uncaught"] == ["uncaught", None, None, 0]
    assert results["index_error_in_loop"] == ["uncaught", None, None, 0]
    assert results["ignored"] == ["uncaught", None, None, 0]


def test_c_code_between_frames_may_catch(answers):
    results, lines = answers
    assert results["c-code"] == ["c-code", "through_c", PY, lines["c-code"]]


def test_with_blocks(answers):
    results, lines = answers
    assert results["with"] == ["with", "in_with", PY, lines["with"]]
    assert results["suppress"] == ["caught", "in_suppress", PY, lines["suppress"]]
    assert results["suppress_other"] == ["uncaught", None, None, 0]
    assert results["contextmanager"] == ["caught", "tolerant", PY, lines["contextmanager"]]
    assert results["contextmanager_other"] == ["uncaught", None, None, 0]


def test_the_analysis_runs_none_of_the_programs_code(answers):
    results, _ = answers
    # Neither the property of the suppress subclass nor the trap's __getattr__ or __exit__
    # ran: the first with only "may" suppress it.
    assert results["traps"][:2] == ["with", "traps"]
    assert results["side_effects"] == []
    assert results["pending_after"] == "(None, None, None)"


def test_bad_arguments_are_refused_with_type_error(answers):
    results, _ = answers
    assert "must be a frame" in results["not_a_frame"][1]
    assert "must be an exception" in results["not_an_exception"][1]
    assert "must be a dict or None" in results["ignored_not_a_dict"][1]
    assert results["no_arguments"][0] == "TypeError"
    for name in ("prefixes_str", "prefixes_int", "prefixes_none"):
        assert results[name][0] == "TypeError"
    assert results["prefixes_kept"] == ["/nowhere/lib"]
