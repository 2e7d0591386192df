"""Peak memory while a program makes and drops a million functions, untraced and under the core.

Usage: python memory.py [--functions N] [--event-source settrace|monitoring|both] [--json]

The program compiles a small `def`, makes a function of its code object, calls it once and
drops it, N times (default 1,000,000): every function has a code object of its own, which the
core meets once (a call, its lines and a return) and never again. The core keeps tables keyed
by code object (which code it has decided about, which file a code belongs to, the
sub-language caches); they must not grow with the number of code objects the program has ever
made.

The *-exec configurations make each function by running the compiled module with exec
instead, so a module-level code object of a file also runs each time: the core reports each
such run to the server side as an import (get_new_imports), a list that grows until the server
side takes it, which a program running freely never lets it do.

Each configuration runs in a process of its own, so that its peak resident size
(resource.getrusage's ru_maxrss) is its own:
  untraced                no tracer
  core-free               the core running freely (continue_run)
  core-bp-unreached       the same with a breakpoint in the file of the made functions, on a
                          line they never reach (their code has line events on)
  core-sublang-loaded     the same as core-free with a sub-language hook registered and
                          loaded: every call event looks its code up in the marker cache
  untraced-exec, core-free-exec   as untraced and core-free, the module run with exec
The core's configurations run once per event source (as in run_bench.py). The resident size
is also read from /proc/self/statm after each tenth of the functions, so the table shows
whether it keeps growing (a table that is never swept) or levels off.

With --json the results go to memory-<python version>.json beside this script.
"""

import argparse
import gc
import json
import os
import platform
import resource
import subprocess
import sys

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, HERE)

VERSION = platform.python_version()
CONFIGS = ("untraced", "core-free", "core-bp-unreached", "core-sublang-loaded",
           "untraced-exec", "core-free-exec")
# Lines 1 and 2 run; line 4 never does (the breakpoint of core-bp-unreached).
SOURCE = "def made(x):\n    return x + 1\n\ndef never():\n    return None\n"
FILENAME = os.path.join(HERE, "made-functions.py")  # not a real file: no line is read


def rss_kib():
    with open("/proc/self/statm") as f:
        return int(f.read().split()[1]) * os.sysconf("SC_PAGE_SIZE") // 1024


def child(config, functions):
    import types

    import run_bench

    with_exec = config.endswith("-exec")
    config = config.removesuffix("-exec")
    core = None
    if config != "untraced":
        core = run_bench._core()
        counter = run_bench._CallbackCounter()
        run_bench._init_core(core, counter.line, counter.ret, counter.exc)
        if config == "core-bp-unreached":
            core.set_break(FILENAME, 5, 1, 0, None, 0)
        elif config == "core-sublang-loaded":
            core.register_sub_language_hook(
                run_bench._BenchHook(run_bench._marker, run_bench._never_called_here))
        core.continue_run()
        core.start_trace()
    start = rss_kib()
    checkpoints = []
    step = max(1, functions // 10)
    try:
        for i in range(functions):
            namespace = {}
            module = compile(SOURCE, FILENAME, "exec")
            if with_exec:
                exec(module, namespace)
                namespace["made"](i)
            else:
                made = next(c for c in module.co_consts
                            if isinstance(c, types.CodeType) and c.co_name == "made")
                types.FunctionType(made, namespace)(i)
                del made
            del namespace, module
            if (i + 1) % step == 0:
                checkpoints.append(rss_kib())
    finally:
        if core is not None:
            core.stop_trace()
            core.reset()
    gc.collect()
    if core is not None and any(counter.calls.values()):
        raise SystemExit(f"the core stopped: {counter.calls}")
    if with_exec:
        config += "-exec"
    return {"config": config, "source": os.environ.get("SELVANE_EVENT_SOURCE"),
            "functions": functions, "rss_start_kib": start, "rss_checkpoints_kib": checkpoints,
            "maxrss_kib": resource.getrusage(resource.RUSAGE_SELF).ru_maxrss}


def main(argv=None):
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument("--functions", type=int, default=1_000_000)
    parser.add_argument("--event-source", default="both",
                        choices=("settrace", "monitoring", "both"))
    parser.add_argument("--only", default="", help="comma-separated configurations")
    parser.add_argument("--json", action="store_true")
    parser.add_argument("--child", default="", help=argparse.SUPPRESS)
    args = parser.parse_args(argv)
    if args.child:
        print(json.dumps(child(args.child, args.functions)))
        return 0

    sources = (("settrace", "monitoring") if hasattr(sys, "monitoring") else ("settrace",)) \
        if args.event_source == "both" else (args.event_source,)
    configs = [c for c in args.only.split(",") if c] or list(CONFIGS)
    results = []
    for config in configs:
        for source in ((None,) if config.startswith("untraced") else sources):
            env = dict(os.environ)
            env.pop("SELVANE_EVENT_SOURCE", None)
            if source:
                env["SELVANE_EVENT_SOURCE"] = source
            done = subprocess.run([sys.executable, __file__, "--child", config,
                                   "--functions", str(args.functions)],
                                  capture_output=True, text=True, env=env)
            if done.returncode != 0:
                print(f"{config} [{source}] failed: {done.stderr.strip()[-500:]}")
                continue
            results.append(json.loads(done.stdout.strip().splitlines()[-1]))

    print(f"CPython {VERSION}: {args.functions} functions made, called once and dropped; "
          "resident size in MiB")
    bases = {r["config"]: r["maxrss_kib"] for r in results if r["config"].startswith("untraced")}
    print(f"{'configuration':<36}{'start':>8}{'peak':>8}{'+ untraced':>12}   "
          "after each tenth")
    for r in results:
        name = r["config"] + (f" [{r['source']}]" if r["source"] else "")
        base = bases.get("untraced-exec" if r["config"].endswith("-exec") else "untraced")
        extra = f"{(r['maxrss_kib'] - base) / 1024:+.1f}" if base else "-"
        tenths = " ".join(f"{c / 1024:.0f}" for c in r["rss_checkpoints_kib"])
        print(f"{name:<36}{r['rss_start_kib'] / 1024:>8.1f}{r['maxrss_kib'] / 1024:>8.1f}"
              f"{extra:>12}   {tenths}")
    if args.json:
        path = os.path.join(HERE, f"memory-{VERSION}.json")
        with open(path, "w") as f:
            json.dump({"python": VERSION, "functions": args.functions, "runs": results}, f,
                      indent=2)
            f.write("\n")
        print(f"wrote {path}")
    return 0


if __name__ == "__main__":
    sys.exit(main())
