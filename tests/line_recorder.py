"""Records the line events that a plain sys.settrace function sees while a program runs.

Usage: python line_recorder.py PROGRAM OUT.json

It mirrors scripted_server.py's way of running the program (runpy.run_path as __main__
after setting sys.argv and putting the program's folder first on sys.path) so that the two
runs execute the same code, and records every line event of the main thread outside this
file.
"""

import json
import os
import runpy
import sys
import threading

# The scripted server side's imports (the core included): the program must find the same
# modules already loaded, or its imports would run different import-machinery lines.
import scripted_server  # noqa: F401

_SELF = os.path.abspath(__file__)


def main(program, out):
    events = []

    def tracer(frame, event, arg):
        if frame.f_code.co_filename == _SELF:
            return tracer
        if event == "line":
            events.append((os.path.basename(frame.f_code.co_filename), frame.f_lineno,
                           frame.f_code.co_name))
        return tracer

    # Everything the harness itself runs happens before tracing starts, so that only the
    # program's own run is recorded (the server records from the same point).
    program = os.path.abspath(program)
    sys.argv = [program]
    sys.path.insert(0, os.path.dirname(program))
    main_ident = threading.get_ident()
    sys.settrace(tracer)
    try:
        runpy.run_path(program, run_name="__main__")
    finally:
        sys.settrace(None)
        with open(out, "w") as f:
            json.dump(events, f)
    assert threading.get_ident() == main_ident


if __name__ == "__main__":
    main(sys.argv[1], sys.argv[2])
