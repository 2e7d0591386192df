"""Differential tests of breakpoints against the standard library's bdb.

Each program runs twice with the same breakpoints (file, line, enabled, temporary, condition,
ignore count): once under bdb (bdb_runner.py, a small bdb.Bdb subclass) and once under the
core (scripted_server.py), both running freely from the start and both recording, at every
stop, the place (file, line, function) and the ignore count and hit count of every breakpoint
that still exists, by number. bdb numbers its breakpoints from 1 in the order they are set,
as the core gives its ids, so the records compare directly.

Where the two define the same behaviour the records must be equal: a hit is counted at every
pass over an enabled breakpoint's line before its condition and ignore count are looked at;
the ignore count is used up by passes whose condition is true (or that have no condition);
a condition that cannot be evaluated stops without touching the ignore count or the
temporary flag; a temporary breakpoint that stops is deleted at that stop.

The differences the core must keep, each tested below with its reason:
  1. Several breakpoints on one line: bdb acts on the first one (the oldest) that stops and
     leaves the later ones uncounted; the core walks every breakpoint of the line, newest
     first, counting each one and applying each one's ignore count and temporary flag, and
     stops if any of them stops (the core's hit test has no early exit, so that every
     breakpoint's counters stay true).
  2. The empty condition: bdb treats "" as no condition; the core keeps it as a condition
     (set_breaks_cond documents "" as "no conditional", but the record stores an empty text),
     which cannot be evaluated and so stops every time, leaving the ignore count and the
     temporary flag alone.
  3. Stops made by stepping: bdb looks at breakpoints only where stepping does not already
     stop, so stepping over a breakpoint's line counts nothing; the core updates the counters
     of the line's breakpoints at every stop, whatever its reason.
"""

import json
import os
import subprocess
import sys
import textwrap


from conftest import TIMEOUT, assert_stops, run_traced, write_program

HERE = os.path.dirname(os.path.abspath(__file__))
RUNNER = os.path.join(HERE, "bdb_runner.py")


def marked(source, tag):
    lines = textwrap.dedent(source).lstrip("\n").splitlines()
    found = [i + 1 for i, text in enumerate(lines) if text.rstrip().endswith("# " + tag)]
    assert len(found) == 1, tag
    return found[0]


def run_bdb(tmp_path, program, breaks, files, mode="continue"):
    out = tmp_path / "bdb.json"
    config = tmp_path / "bdb-config.json"
    config.write_text(json.dumps(dict(program=program, out=str(out), breaks=breaks, files=files,
                                      mode=mode)))
    proc = subprocess.run([sys.executable, RUNNER, str(config)], capture_output=True, text=True,
                          timeout=TIMEOUT, cwd=str(tmp_path))
    assert proc.returncode == 0, proc.stderr
    data = json.loads(out.read_text())
    return proc.stdout, [tuple(s) for s in data["stops"]], data["final"]


def run_core(tmp_path, program, breaks, files, mode="continue"):
    names = sorted({b[0] for b in breaks})
    state = f"sorted([b[1], b[5], b[6]] for f in {names!r} for b in core.get_file_breaks(f))"
    command = "step_into" if mode == "step" else "continue_run"
    run = run_traced(tmp_path, program, breaks=breaks, files=files, probe=state,
                     after_stop=state, first=command, default=command, when_elsewhere=command)
    assert run.returncode == 0, run.stderr
    stops = [tuple(s[1:4]) + (s[4],) for s in run.stops if s[0] == "line"]
    return run.stdout, stops, run.after_stop


def both(tmp_path, source, breaks, modules=None, files=("prog.py",), mode="continue"):
    """Writes the program (and modules), makes the breakpoints' file names absolute, and runs
    it under bdb and under the core. Answers (bdb stops, bdb final, core stops, core final)."""
    program = write_program(tmp_path, source)
    for name, text in (modules or {}).items():
        write_program(tmp_path, text, name)
    breaks = [[str(tmp_path / b[0])] + list(b[1:]) for b in breaks]
    files = list(files)
    bdb_out, bdb_stops, bdb_final = run_bdb(tmp_path, program, breaks, files, mode)
    core_out, core_stops, core_final = run_core(tmp_path, program, breaks, files, mode)
    assert core_out == bdb_out
    return bdb_stops, bdb_final, core_stops, core_final


def agree(tmp_path, source, breaks, **kwargs):
    bdb_stops, bdb_final, core_stops, core_final = both(tmp_path, source, breaks, **kwargs)
    assert bdb_stops, "the program must stop somewhere"
    assert_stops(core_stops, bdb_stops)
    assert core_final == bdb_final
    return core_stops


# ---- programs where the two agree -----------------------------------------------------------

COUNTERS = """
def step(i, acc):
    acc.append(i)  # append
    return len(acc)  # length

def run():
    acc = []
    for i in range(10):
        n = step(i, acc)  # call
        if n > 7:
            break  # leave
    total = sum(acc)  # total
    return total

print(run())
for k in range(4):
    v = k * k  # square
print(v)
"""


def test_conditions_ignore_counts_and_temporary_breakpoints_agree(tmp_path):
    m = lambda tag: marked(COUNTERS, tag)  # noqa: E731
    stops = agree(tmp_path, COUNTERS, [
        ["prog.py", m("append"), 1, 0, "i % 3 == 0", 1],   # true at 0, 3, 6, 9; one ignored
        ["prog.py", m("length"), 1, 1, "i >= 4", 0],       # temporary, fires at i == 4
        ["prog.py", m("call"), 1, 0, None, 5],             # six passes ignored
        ["prog.py", m("leave"), 1, 1, None, 0],            # temporary, fires once
        ["prog.py", m("total"), 0, 0, None, 0],            # disabled: never counts
        ["prog.py", m("square"), 1, 1, "k > 0", 1],        # temporary with an ignore count
    ])
    assert len(stops) >= 6


RAISING = """
import sys

def f(x):
    y = x + 1  # broken
    z = y * 2  # false
    return z  # runs

for x in range(3):
    f(x)
try:
    raise KeyError("k")
except KeyError:
    w = 1  # inexcept
    print(repr(sys.exc_info()[1]))
"""


def test_conditions_that_cannot_be_evaluated_agree(tmp_path):
    m = lambda tag: marked(RAISING, tag)  # noqa: E731
    agree(tmp_path, RAISING, [
        ["prog.py", m("broken"), 1, 1, "no_such_name > 1", 2],  # stops, temporary kept
        ["prog.py", m("false"), 1, 0, "y > 100", 0],            # counts, never stops
        ["prog.py", m("runs"), 1, 0, "1 +", 0],                 # not valid Python
        ["prog.py", m("inexcept"), 1, 0, "1 / 0", 0],           # raises while handling
    ])


NESTED = """
import mod

def fib(n):
    if n < 2:  # base
        return n
    return fib(n - 1) + fib(n - 2)

def gen(n):
    for i in range(n):
        yield i * 2  # yielded

class Box:
    size = 3  # classline

def squares(n):
    # In a function: bdb on 3.12 breaks a module-level comprehension it evaluates a
    # condition in (its trace function writes the frame's locals back).
    return [
        q * q  # element
        for q in range(n)
    ]

print(fib(5), list(gen(3)), sorted([3, 1, 2], key=mod.key), squares(4), Box.size)
"""

MOD = """
def key(v):
    return -v  # keyline
"""


def test_recursion_generators_calls_from_c_and_other_files_agree(tmp_path):
    m = lambda tag: marked(NESTED, tag)  # noqa: E731
    agree(tmp_path, NESTED, [
        ["prog.py", m("base"), 1, 0, "n == 1", 2],
        ["prog.py", m("yielded"), 1, 0, None, 1],
        ["prog.py", m("classline"), 1, 1, None, 0],
        ["prog.py", m("element"), 1, 0, "q % 2", 0],
        ["mod.py", marked(MOD, "keyline"), 1, 0, "v != 1", 0],
    ], modules={"mod.py": MOD}, files=("prog.py", "mod.py"))


# ---- the differences the core keeps ---------------------------------------------------------

TWICE = """
for i in range(3):
    x = i  # line
print(x)
"""


def test_difference_1_every_breakpoint_of_a_line_is_counted(tmp_path):
    at = marked(TWICE, "line")
    bdb_stops, bdb_final, core_stops, core_final = both(tmp_path, TWICE, [
        ["prog.py", at, 1, 0, None, 1],   # 1: ignores one pass
        ["prog.py", at, 1, 0, None, 0],   # 2: stops at every pass
    ])
    # Both stop at every pass. bdb: pass 1, #1 is ignored and #2 stops; passes 2 and 3, #1
    # stops first and #2 is not looked at. The core counts both at every pass.
    assert [s[:3] for s in bdb_stops] == [("prog.py", at, "<module>")] * 3
    assert [s[:3] for s in core_stops] == [("prog.py", at, "<module>")] * 3
    assert [s[3] for s in bdb_stops] == [[[1, 0, 1], [2, 0, 1]], [[1, 0, 2], [2, 0, 1]],
                                         [[1, 0, 3], [2, 0, 1]]]
    assert [s[3] for s in core_stops] == [[[1, 0, 1], [2, 0, 1]], [[1, 0, 2], [2, 0, 2]],
                                          [[1, 0, 3], [2, 0, 3]]]
    assert bdb_final == [[1, 0, 3], [2, 0, 1]]
    assert core_final == [[1, 0, 3], [2, 0, 3]]


def test_difference_1_a_temporary_behind_a_stopping_breakpoint_still_fires(tmp_path):
    at = marked(TWICE, "line")
    bdb_stops, bdb_final, core_stops, core_final = both(tmp_path, TWICE, [
        ["prog.py", at, 1, 0, None, 0],   # 1: stops at every pass
        ["prog.py", at, 1, 1, None, 0],   # 2: temporary
    ])
    # bdb never gets past #1, so #2 never fires; the core fires #2 at the first pass.
    assert [s[3] for s in bdb_stops] == [[[1, 0, 1], [2, 0, 0]], [[1, 0, 2], [2, 0, 0]],
                                         [[1, 0, 3], [2, 0, 0]]]
    assert [s[3] for s in core_stops] == [[[1, 0, 1]], [[1, 0, 2]], [[1, 0, 3]]]
    assert bdb_final == [[1, 0, 3], [2, 0, 0]]
    assert core_final == [[1, 0, 3]]


def test_difference_2_the_empty_condition_stops_every_time(tmp_path):
    at = marked(TWICE, "line")
    bdb_stops, bdb_final, core_stops, core_final = both(tmp_path, TWICE, [
        ["prog.py", at, 1, 1, "", 2],
    ])
    # bdb: no condition, two passes ignored, the temporary breakpoint fires at the third.
    assert bdb_stops == [("prog.py", at, "<module>", [])]
    assert bdb_final == []
    # The core: a condition that cannot be evaluated, at every pass, counters untouched.
    assert core_stops == [("prog.py", at, "<module>", [[1, 2, n]]) for n in (1, 2, 3)]
    assert core_final == [[1, 2, 3]]


def test_difference_3_stepping_stops_count_breakpoint_hits(tmp_path):
    at = marked(TWICE, "line")
    bdb_stops, bdb_final, core_stops, core_final = both(tmp_path, TWICE, [
        ["prog.py", at, 1, 0, None, 5],
    ], mode="step")
    # Both stop at every line of the program when stepping ...
    assert [s[:3] for s in core_stops] == [s[:3] for s in bdb_stops]
    assert [s[:3] for s in core_stops].count(("prog.py", at, "<module>")) == 3
    # ... but only the core counts the passes over the breakpoint's line.
    assert bdb_final == [[1, 5, 0]]
    assert core_final == [[1, 2, 3]]
