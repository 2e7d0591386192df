"""Entry point of ``python -m selvane``.

The console debugger is not written yet. Until it is, this entry loads the native core,
initialises it, traces the given script with a recording server side that steps into every
line, and prints what the core answered: enough to see the core work on a real program.
"""

import os
import runpy
import sys

import tvantrel30pydebugstackless as core


class _Recorder:
    def __init__(self, script):
        self.script = os.path.abspath(script)
        self.lines = 0

    def line_cb(self, frame, changed):
        if frame.f_code.co_filename == self.script:
            self.lines += 1
            print(f"selvane: line {frame.f_lineno:4d} in {frame.f_code.co_name}", file=sys.stderr)
        core.step_into()

    def return_cb(self, frame, value, changed):
        core.step_into()

    def exception_cb(self, frame, exc, changed):
        core.step_into()


def main(argv):
    if len(argv) != 1:
        print("usage: python -m selvane script.py", file=sys.stderr)
        return 2
    script = os.path.abspath(argv[0])
    recorder = _Recorder(script)
    core.init(0.0, 0, lambda flag: None, lambda: None, recorder.line_cb, recorder.return_cb,
              recorder.exception_cb, lambda: None, None, __import__, None, {})
    print(f"selvane: core loaded, tracing active: {core.get_tracing()}", file=sys.stderr)
    sys.argv = [script]
    core.step_into()
    core.start_trace()
    try:
        runpy.run_path(script, run_name="__main__")
    finally:
        core.stop_trace()
        threads = core.get_threads()
        print(f"selvane: stopped on {recorder.lines} lines of {script}; "
              f"threads seen: {len(threads)}; tracing active: {core.get_tracing()}",
              file=sys.stderr)
        core.reset()
    return 0


if __name__ == "__main__":
    sys.exit(main(sys.argv[1:]))
