"""Runs a program under the standard library's bdb with breakpoints, for the differential
tests of test_bdb_differential.py, and records where it stopped.

Usage: python bdb_runner.py CONFIG.json

Configuration keys (the breakpoint format is the one of scripted_server.py's "breaks"):
  program   path of the program to run as __main__ (runpy.run_path, its folder first on
            sys.path, as scripted_server.py runs it)
  out       path of the JSON file to write the results to
  breaks    list of [file, line, enabled, temporary, cond, ignore_count]; bdb numbers them
            from 1 in this order
  mode      "continue" (default): run freely to each breakpoint; "step": stop at every line
  files     base names of the files whose stops are recorded (default: the program's)

Each recorded stop is [file base name, line, function, [[number, ignore, hits], ...]] with
the state of every breakpoint that still exists, by number. The results also hold the final
state of the breakpoints as "final".
"""

import bdb
import json
import os
import runpy
import sys


class Recorder(bdb.Bdb):
    def __init__(self, mode, files):
        super().__init__()
        self.mode = mode
        self.files = files
        self.stops = []

    def state(self):
        return [[bp.number, bp.ignore, bp.hits] for bp in bdb.Breakpoint.bpbynumber[1:]
                if bp is not None]

    def resume(self):
        if self.mode == "step":
            self.set_step()
        else:
            self.set_continue()

    def user_call(self, frame, argument_list):
        # The first event (runcall's own call) arrives here; after it, bdb reports calls only
        # where it stops, and this runner stops at lines only.
        self.resume()

    def user_line(self, frame):
        name = os.path.basename(frame.f_code.co_filename)
        if name in self.files:
            self.stops.append([name, frame.f_lineno, frame.f_code.co_name, self.state()])
        self.resume()

    def user_return(self, frame, return_value):
        self.resume()

    def user_exception(self, frame, exc_info):
        self.resume()

    def do_clear(self, arg):
        # bdb calls this to delete a temporary breakpoint that fired.
        self.clear_bpbynumber(arg)


def main(config_path):
    with open(config_path) as f:
        config = json.load(f)
    program = os.path.abspath(config["program"])
    debugger = Recorder(config.get("mode", "continue"),
                        set(config.get("files", [os.path.basename(program)])))
    for file, line, enabled, temporary, cond, ignore in config.get("breaks", []):
        error = debugger.set_break(os.path.abspath(file), line, bool(temporary), cond)
        if error:
            raise SystemExit(f"bdb refused the breakpoint {file}:{line}: {error}")
        bp = debugger.get_breaks(os.path.abspath(file), line)[-1]
        bp.ignore = ignore
        bp.enabled = bool(enabled)
    sys.argv = [program]
    sys.path.insert(0, os.path.dirname(program))
    try:
        debugger.runcall(runpy.run_path, program, run_name="__main__")
    finally:
        sys.settrace(None)
        with open(config["out"], "w") as f:
            json.dump({"stops": debugger.stops, "final": debugger.state()}, f)


if __name__ == "__main__":
    main(sys.argv[1])
