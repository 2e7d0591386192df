"""Builds the _null_tracer extension for the interpreter that runs this script.

Usage: python build.py OUTPUT_DIR

It calls the C compiler the interpreter was built with, on the interpreter's own headers,
with the optimisation level of the debugger core's default build (-O2 -g), so that the two
are compared on equal terms. No setuptools needed: one file, one compiler call.
"""

import os
import shlex
import subprocess
import sys
import sysconfig

HERE = os.path.dirname(os.path.abspath(__file__))


def main(out_dir):
    os.makedirs(out_dir, exist_ok=True)
    compiler = shlex.split(sysconfig.get_config_var("CC") or "cc")
    target = os.path.join(out_dir, "_null_tracer" + sysconfig.get_config_var("EXT_SUFFIX"))
    command = compiler + [
        "-O2", "-g", "-fPIC", "-shared", "-Wall", "-Wextra",
        "-I", sysconfig.get_paths()["include"],
        os.path.join(HERE, "_null_tracer.c"), "-o", target,
    ]
    subprocess.run(command, check=True)
    print(target)


if __name__ == "__main__":
    if len(sys.argv) != 2:
        sys.exit(__doc__)
    main(sys.argv[1])
