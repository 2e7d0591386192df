"""CPython's own regression tests as the judge that the program behaves under the debugger as
it does untraced: a small selection, run freely under `python -m selvane` with stdin closed,
must give the same results as untraced with nothing printed by the debugger. The whole list is
`tools/regrtests-traced` (see the README).

Most of the selection runs with the default exception setting, stopping at unhandled
exceptions. These modules raise and catch a great many exceptions, through C code (`hasattr`,
iteration, `copy`), `with` blocks and `contextlib`, and catch everything they raise: any stop
is a false one, and would show here as a difference (stdin is closed, so a stop quits). The
modules that unwind exceptions through thousands of frames (test_exceptions, test_json) run
with `--exceptions never`: they cover what the debugger keeps about caught exceptions
(finalisers, deep unwinding, exceptions in handlers) without the analysis, whose walk per
frame still grows with the depth of the stack.
"""

import os
import subprocess
import sys

import pytest

HERE = os.path.dirname(os.path.abspath(__file__))
TOOL = os.path.join(os.path.dirname(HERE), "tools", "regrtests-traced")
# exception setting -> modules
SELECTION = {
    None: ["test.test_with", "test.test_contextlib", "test.test_raise", "test.test_re",
           "test.test_copy", "test.test_collections", "test.test_dataclasses",
           "test.test_typing"],
    "never": ["test.test_exceptions", "test.test_json"],
}


@pytest.mark.parametrize("exceptions", sorted(SELECTION, key=str))
def test_a_selection_of_the_interpreters_regression_tests_runs_as_untraced(tmp_path, exceptions):
    options = ["--exceptions", exceptions] if exceptions else []
    run = subprocess.run([sys.executable, TOOL, "--python", sys.executable, *options,
                          *SELECTION[exceptions]], capture_output=True,
                         text=True, timeout=1200, cwd=str(tmp_path))
    lines = run.stdout.splitlines()
    if lines and all(line.endswith("skipped") for line in lines[:-1]):
        pytest.skip("this interpreter has no regression test package")
    assert run.returncode == 0, run.stdout + run.stderr
    assert sum(line.startswith("same ") for line in lines) >= 1, run.stdout
