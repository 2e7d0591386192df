"""Conditional breakpoints on a hot line: the debugger against untraced runs, pdb and debugpy.

Usage: python conditions.py [--iterations N] [--peer-iterations M] [--repeats R]
                            [--event-source settrace|monitoring|both] [--debugpy-python PY]
                            [--no-peers] [--instructions] [--instruction-passes K] [--json]

Each row runs cond_loop.py in a process of its own, with a breakpoint on the loop's body line
whose condition is never true, and reports the best of R loop times (the program times the
loop itself, so start-up is not counted) and its ratio to the untraced loop of the same
number of iterations:
  untraced            no debugger
  selvane COND [SRC]  python -m selvane -c 'b FILE:LINE, COND' -c c, per event source
  pdb COND            python -m pdb -c 'b FILE:LINE, COND' -c c
  debugpy COND        debugpy listening, a client attached over loopback that sets the
                      breakpoint with the condition (debug adapter protocol), then running
pdb and debugpy run M iterations (default N/10: they take tens of microseconds a pass) and are
compared with the untraced loop of M iterations. The conditions: "i == -1" (simple: the
common comparison of a local with a constant) and "abs(i) < 0" (a function call in it).
With --instructions the untraced and selvane rows are also counted in instructions under
callgrind (valgrind): the count of a run of K iterations (--instruction-passes, default
N/10) less that of a run of K/2, so
that start-up cancels out; a count does not depend on what else the machine is doing.
With --json the rows also go to conditions-<python version>.json beside this script.
"""

import argparse
import json
import os
import platform
import subprocess
import sys

HERE = os.path.dirname(os.path.abspath(__file__))
ROOT = os.path.dirname(HERE)
LOOP = os.path.join(HERE, "cond_loop.py")
CONDITIONS = ("i == -1", "abs(i) < 0")
TIMEOUT = 1200


def body_line():
    with open(LOOP) as source:
        for number, text in enumerate(source, 1):
            if text.rstrip().endswith("# the breakpoint's line"):
                return number
    raise RuntimeError("cond_loop.py has no breakpoint line")


def elapsed_of(command, env=None, stdin_text=""):
    """The loop time that the program printed."""
    run = subprocess.run(command, capture_output=True, text=True, timeout=TIMEOUT,
                         env=env, input=stdin_text, cwd=HERE)
    for text in run.stdout.splitlines():
        if "elapsed " in text:
            return float(text.rsplit("elapsed ", 1)[1].split()[0])
    raise RuntimeError(f"{command} printed no time (status {run.returncode}):\n"
                       f"{run.stdout[-2000:]}\n{run.stderr[-2000:]}")


def best(repeats, command, env=None, stdin_text=""):
    return min(elapsed_of(command, env, stdin_text) for _ in range(repeats))


def selvane_command(n, cond):
    return [sys.executable, "-m", "selvane", "-c", f"b {LOOP}:{body_line()}, {cond}",
            "-c", "c", LOOP, str(n)]


def pdb_command(n, cond):
    return [sys.executable, "-m", "pdb", "-c", f"b {LOOP}:{body_line()}, {cond}", "-c", "c",
            LOOP, str(n)]


def debugpy_command(python, n, cond):
    return [python, os.path.abspath(__file__), "--debugpy-child", str(n), cond]


# ---- the debugpy child: the program under debugpy, and its client ---------------------------


def debugpy_client(port, line, cond):
    sys.path.insert(0, HERE)
    from debugpy_child import Connection, response_to

    connection = Connection(port)
    connection.wait_for(response_to(connection.request(
        "initialize", clientID="selvane-bench", adapterID="debugpy", pathFormat="path",
        linesStartAt1=True, columnsStartAt1=True)))
    connection.request("attach", justMyCode=True)
    connection.wait_for(lambda m: m.get("type") == "event" and m.get("event") == "initialized")
    connection.wait_for(response_to(connection.request(
        "setBreakpoints", source={"path": LOOP},
        breakpoints=[{"line": line, "condition": cond}])))
    connection.wait_for(response_to(connection.request("configurationDone")))
    print("configured", flush=True)
    connection.sock.settimeout(None)
    while connection.receive() is not None:
        pass


def debugpy_child(n, cond):
    import debugpy

    debugpy.configure(subProcess=False)
    _, port = debugpy.listen(("127.0.0.1", 0))
    client = subprocess.Popen([sys.executable, os.path.abspath(__file__), "--debugpy-client",
                               str(port), str(body_line()), cond], stdout=subprocess.PIPE,
                              text=True)
    try:
        debugpy.wait_for_client()
        client.stdout.readline()
        sys.argv = [LOOP, str(n)]
        with open(LOOP) as source:
            code = compile(source.read(), LOOP, "exec")
        exec(code, {"__name__": "__main__", "__file__": LOOP})
    finally:
        client.terminate()
        client.wait(timeout=10)


def instructions(command, env=None, stdin_text=""):
    run = subprocess.run(["valgrind", "--tool=callgrind", "--callgrind-out-file=/dev/null"]
                         + command, capture_output=True, text=True, timeout=TIMEOUT * 4,
                         env=env, input=stdin_text, cwd=HERE)
    for text in run.stderr.splitlines():
        if "Collected :" in text:
            return int(text.rsplit(":", 1)[1])
    raise RuntimeError(f"callgrind gave no count for {command}:\n{run.stderr[-2000:]}")


def instructions_per_pass(make_command, n, env=None):
    """Instructions of one loop pass: the counts of n and n/2 passes, subtracted."""
    full = instructions(make_command(n), env)
    half = instructions(make_command(n // 2), env)
    return (full - half) / (n - n // 2)


# ---- the table ----------------------------------------------------------------------------


def main(argv=None):
    parser = argparse.ArgumentParser()
    parser.add_argument("--iterations", type=int, default=2_000_000)
    parser.add_argument("--peer-iterations", type=int, default=0)
    parser.add_argument("--repeats", type=int, default=3)
    parser.add_argument("--event-source", default="both",
                        choices=("settrace", "monitoring", "both"))
    parser.add_argument("--debugpy-python", default=None)
    parser.add_argument("--no-peers", action="store_true")
    parser.add_argument("--json", action="store_true")
    parser.add_argument("--instructions", action="store_true")
    parser.add_argument("--instruction-passes", type=int, default=0)
    args = parser.parse_args(argv)
    n = args.iterations
    m = args.peer_iterations or max(1, n // 10)
    sources = ["settrace", "monitoring"] if args.event_source == "both" else [args.event_source]
    if not hasattr(sys, "monitoring"):
        sources = ["settrace"]
    untraced = {k: best(args.repeats, [sys.executable, LOOP, str(k)]) for k in {n, m}}
    rows = [("untraced", n, untraced[n])]
    for cond in CONDITIONS:
        for source in sources:
            env = dict(os.environ, SELVANE_EVENT_SOURCE=source)
            rows.append((f"selvane {cond} [{source}]", n,
                         best(args.repeats, selvane_command(n, cond), env)))
        if args.no_peers:
            continue
        rows.append((f"pdb {cond}", m, best(args.repeats, pdb_command(m, cond), None, "q\n")))
        if args.debugpy_python:
            rows.append((f"debugpy {cond}", m,
                         best(args.repeats, debugpy_command(args.debugpy_python, m, cond))))
    print(f"Python {platform.python_version()}, best of {args.repeats}")
    print(f"{'row':38} {'iterations':>10} {'loop s':>9} {'per pass':>10} {'x untraced':>10}")
    table = []
    for label, k, seconds in rows:
        ratio = seconds / untraced[k]
        per_pass = (seconds - untraced[k]) / k * 1e9
        print(f"{label:38} {k:>10} {seconds:>9.3f} {per_pass:>8.0f}ns {ratio:>10.2f}")
        table.append({"row": label, "iterations": k, "seconds": seconds,
                      "ns_per_pass_over_untraced": per_pass, "ratio": ratio})
    counted = []
    if args.instructions:
        k = args.instruction_passes or max(2, n // 10)
        base = instructions_per_pass(lambda i: [sys.executable, LOOP, str(i)], k)
        counted.append(("untraced", base))
        for cond in CONDITIONS:
            for source in sources:
                env = dict(os.environ, SELVANE_EVENT_SOURCE=source)
                counted.append((f"selvane {cond} [{source}]", instructions_per_pass(
                    lambda i, c=cond: selvane_command(i, c), k, env)))
        print(f"\ninstructions per loop pass (callgrind, {k} against {k // 2} passes)")
        for label, count in counted:
            print(f"{label:38} {count:>10.0f} {count / base:>10.2f}")
    if args.json:
        out = os.path.join(HERE, f"conditions-{platform.python_version()}.json")
        with open(out, "w") as handle:
            json.dump({"python": platform.python_version(), "rows": table,
                       "instructions_per_pass": dict(counted)}, handle, indent=1)


if __name__ == "__main__":
    if len(sys.argv) == 4 and sys.argv[1] == "--debugpy-child":
        debugpy_child(int(sys.argv[2]), sys.argv[3])
    elif len(sys.argv) == 5 and sys.argv[1] == "--debugpy-client":
        debugpy_client(int(sys.argv[2]), int(sys.argv[3]), sys.argv[4])
    else:
        main()
