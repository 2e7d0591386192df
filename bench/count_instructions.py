"""Instructions per trace event for each mode of run_bench.py, counted by valgrind's callgrind.

Usage: python count_instructions.py [--iterations N] [--only MODE,...] [--json]
                                    [--event-source settrace|monitoring|both]
                                    [--null-tracer-dir DIR] [--keep DIR]

Wall times on a shared two-core machine move with whatever else runs there; instruction
counts do not. For each mode this runs run_bench.py once under callgrind, with collection
switched on only between the two clock readings around the workload (the warm-up run and one
timed run), and divides the instructions collected by the events of those runs. The result
is what the workload costs per event under that mode, in instructions, with no noise; it
does not see cache misses or branch mispredictions, which the wall times do.

--keep DIR leaves the callgrind output files there, one per mode, for callgrind_annotate
(`callgrind_annotate --inclusive=yes "DIR/callgrind.core-free [monitoring].out"`).
As in run_bench.py, each mode of the core is counted once per event source (--event-source,
default both where the interpreter has sys.monitoring) and its row is labelled with it; each
mode's instructions are divided by the events of its own workload.
With --json the results go to instructions-<python version>.json beside this script
("instructions_per_event" keyed by the row label).

--libc-malloc runs every counted process with PYTHONMALLOC=malloc. The interpreter's own
small-object allocator takes a longer path whenever a pool fills up or empties, so a loop that
makes and drops one integer per iteration pays more or less in it depending on where the pools
stood when the loop began, which anything allocated earlier (a debugger's start-up included)
moves: rows that differ by a percent or two can differ only there, with the same number of
allocations. The C library's allocator serves those same-size requests from a per-thread cache
at a constant price, so with this option such rows compare the work done per event. The JSON
file is then instructions-<python version>-libc-malloc.json.
"""

import argparse
import json
import os
import shutil
import subprocess
import sys
import tempfile

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, HERE)

import run_bench  # noqa: E402

RUNS_PER_MODE = 2  # the warm-up run and one timed run


def collected_instructions(out_file):
    """The instruction total of a callgrind output file."""
    with open(out_file) as f:
        for line in f:
            if line.startswith(("summary:", "totals:")):
                return int(line.split()[1])
    raise RuntimeError(f"no totals in {out_file}")


def counted_env(args):
    """The environment of a counted process (--libc-malloc: the C library's allocator)."""
    return dict(os.environ, PYTHONMALLOC="malloc") if args.libc_malloc else dict(os.environ)


def count_mode(mode, source, args, out_dir):
    out_file = os.path.join(out_dir, f"callgrind.{run_bench.label(mode, source)}.out")
    command = [
        "valgrind", "--tool=callgrind", "--collect-atstart=no", f"--callgrind-out-file={out_file}",
        sys.executable, os.path.join(HERE, "run_bench.py"), "--only", mode, "--repeats", "1",
        "--iterations", str(args.iterations), "--null-tracer-dir", args.null_tracer_dir,
        "--under-callgrind", "--event-source", source or "both",
    ]
    done = subprocess.run(command, capture_output=True, text=True, env=counted_env(args))
    if done.returncode != 0:
        tail = "\n".join(done.stderr.strip().splitlines()[-5:])
        raise RuntimeError(f"{mode}: run under callgrind failed:\n{tail}")
    if "skipped:" in done.stdout:
        return None
    return collected_instructions(out_file)


def count_debugpy(mode, args, out_dir):
    """The debugpy mode's instructions: debugpy_child.py under callgrind, one workload, a
    warm-up and one timed run; the program's threads are counted (the two-thread workload's
    switch collection themselves), debugpy's own threads are not: they wait on their sockets
    while the workload runs."""
    out_file = os.path.join(out_dir, f"callgrind.{mode}.out")
    command = [
        "valgrind", "--tool=callgrind", "--collect-atstart=no", f"--callgrind-out-file={out_file}",
        args.debugpy_python, os.path.join(HERE, "debugpy_child.py"), str(args.iterations), "1",
        run_bench.DEBUGPY_MODES[mode],
    ]
    env = dict(counted_env(args), PYDEVD_DISABLE_FILE_VALIDATION="1",
               BENCH_CALLGRIND_NULL_TRACER=os.path.abspath(args.null_tracer_dir))
    done = subprocess.run(command, capture_output=True, text=True, env=env, timeout=1800)
    lines = done.stdout.strip().splitlines()
    if done.returncode != 0 or not lines or "skip" in json.loads(lines[-1]):
        tail = "\n".join((done.stderr.strip().splitlines() + lines)[-3:])
        print(f"{mode}: not counted ({tail})", file=sys.stderr)
        return None
    return collected_instructions(out_file)


def main(argv=None):
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument("--iterations", type=int, default=10_000)
    parser.add_argument("--only", default="", help="comma-separated modes (default: all)")
    parser.add_argument("--json", action="store_true")
    parser.add_argument("--null-tracer-dir",
                        default=os.path.join(run_bench.ROOT, "build",
                                             f"bench-null-tracer-{run_bench.VERSION}"))
    parser.add_argument("--keep", default="", help="folder for the callgrind output files")
    parser.add_argument("--event-source", default="both",
                        choices=("settrace", "monitoring", "both"))
    parser.add_argument("--debugpy-python", default="",
                        help="interpreter (same version) that has debugpy: the debugpy modes "
                             "are counted too when they are asked for with --only")
    parser.add_argument("--libc-malloc", action="store_true",
                        help="count with PYTHONMALLOC=malloc (see the module's docstring)")
    args = parser.parse_args(argv)

    if shutil.which("valgrind") is None:
        sys.exit("valgrind is not installed (Debian package: valgrind)")
    sys.path.insert(0, args.null_tracer_dir)
    if not run_bench._null_tracer().HAS_CALLGRIND:
        sys.exit("_null_tracer was built without valgrind/callgrind.h: rebuild it")
    modes = [m for m in args.only.split(",") if m] or list(run_bench.MODES)
    unknown = [m for m in modes if m not in run_bench.MODES and m not in run_bench.DEBUGPY_MODES]
    if unknown:
        parser.error(f"unknown modes {unknown}")
    sources = (run_bench.available_sources() if args.event_source == "both"
               else (args.event_source,))
    events_by_workload = {
        kind: sum(run_bench.count_events(args.iterations, run_bench.WORKLOADS[kind]).values())
        for kind in {run_bench.workload_of(m) for m in modes} | {"main"}}
    events = events_by_workload["main"]

    out_dir = args.keep or tempfile.mkdtemp(prefix="callgrind-")
    os.makedirs(out_dir, exist_ok=True)
    per_event = {}
    try:
        for mode, source in run_bench.runs_of(modes, sources):
            if mode in run_bench.DEBUGPY_MODES:
                total = count_debugpy(mode, args, out_dir) if args.debugpy_python else None
            else:
                total = count_mode(mode, source, args, out_dir)
            if total is not None:
                per_event[run_bench.label(mode, source)] = total / (
                    RUNS_PER_MODE * events_by_workload[run_bench.workload_of(mode)])
    finally:
        if not args.keep:
            shutil.rmtree(out_dir, ignore_errors=True)

    print(f"CPython {run_bench.VERSION}, {args.iterations} iterations, {events} events per run "
          f"(by workload: {events_by_workload}), instructions counted by callgrind"
          + (", PYTHONMALLOC=malloc" if args.libc_malloc else ""))
    print(f"{'mode':<36}{'instr/event':>12}{'+ over null':>13}{'x null':>8}{'x untraced':>12}")
    for row_label, value in per_event.items():
        mode, _ = run_bench.mode_and_source(row_label)
        floor = per_event.get(run_bench.floor_of(mode))
        untraced = per_event.get(run_bench.untraced_of(mode))
        above = f"{value - floor:+.0f}" if floor else "-"
        ratio = f"{value / floor:.2f}" if floor else "-"
        ratio_u = f"{value / untraced:.3f}" if untraced else "-"
        print(f"{row_label:<36}{value:>12.1f}{above:>13}{ratio:>8}{ratio_u:>12}")
    if args.json:
        suffix = "-libc-malloc" if args.libc_malloc else ""
        path = os.path.join(HERE, f"instructions-{run_bench.VERSION}{suffix}.json")
        with open(path, "w") as f:
            json.dump({"python": run_bench.VERSION, "iterations": args.iterations,
                       "event_sources": list(sources), "events_per_run": events,
                       "events_per_run_by_workload": events_by_workload,
                       "allocator": "malloc" if args.libc_malloc else "pymalloc",
                       "instructions_per_event": per_event}, f, indent=2)
            f.write("\n")
        print(f"wrote {path}")
    if args.keep:
        print(f"callgrind output files are in {args.keep}")
    return 0


if __name__ == "__main__":
    sys.exit(main())
