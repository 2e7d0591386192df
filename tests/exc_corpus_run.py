"""Runs the generated corpus of raising programs (exc_corpus.py) under the core in exception
mode 2 (stop on unhandled exceptions), all in this one process, and writes, per program, the
raises that really escaped (learnt by running it untraced first) and the raises for which the
exception callback ran.

Usage: python exc_corpus_run.py OUT.json [COUNT [BOUNDARY_COUNT]]

After the COUNT programs of the corpus come BOUNDARY_COUNT (default 0) programs whose
raises pass C code and `with` blocks (exc_corpus.boundary_corpus).

The runner's own frame catches whatever leaves a program; it is registered as an ignored
handler, as a debugger registers its own frames, so that an escaping exception counts as
unhandled. Only the corpus's numbered raises are counted.
"""

import builtins
import itertools
import json
import sys
import threading

import tvantrel30pydebugstackless as core

import exc_corpus

ORIGINAL_IMPORT = builtins.__import__
fired = set()


def exception_cb(frame, exc_arg, changed):
    seq = getattr(exc_arg[1], "_corpus_seq", None)
    if seq is not None:
        fired.add(seq)
    core.continue_run()


def step(*args):
    core.continue_run()


def run_one(code):
    namespace = {"__name__": "__corpus__"}
    try:
        exec(code, namespace)
    except BaseException:
        pass


def main(out, count, boundary_count=0):
    core.init(0.0, 2, lambda flag: threading.settrace(core.bootstrap_new_thread if flag else None),
              lambda: None, step, step, exception_cb, lambda: None, None, ORIGINAL_IMPORT, None,
              {})
    core.set_ignored_exception_handlers({run_one.__code__: 1})
    results = []
    programs = itertools.chain(exc_corpus.corpus(count),
                               exc_corpus.boundary_corpus(boundary_count))
    for name, category, text, raises in programs:
        code = compile(text, "<corpus>", "exec")
        fired.clear()
        core.continue_run()
        core.start_trace()
        run_one(code)
        core.stop_trace()
        results.append({"name": name, "category": category,
                        "escaped": sorted(seq for seq, _tag, escaped in raises if escaped),
                        "raised": len(raises), "fired": sorted(fired)})
    core.reset()
    with open(out, "w") as f:
        json.dump(results, f)


if __name__ == "__main__":
    main(sys.argv[1], int(sys.argv[2]) if len(sys.argv) > 2 else 600,
         int(sys.argv[3]) if len(sys.argv) > 3 else 0)
