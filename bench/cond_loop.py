"""The program of conditions.py: a hot loop whose body line carries the breakpoint.

Usage: python cond_loop.py ITERATIONS
Prints "elapsed SECONDS" for the loop alone (the interpreter's and the debugger's start-up
are not in it).
"""

import sys
import time


def leaf(x):
    return x % 7


def work(n):
    total = 0
    for i in range(n):
        total += leaf(i)  # the breakpoint's line
    return total


def main():
    n = int(sys.argv[1])
    t0 = time.perf_counter(); work(n); t1 = time.perf_counter()  # noqa: E702
    print(f"elapsed {t1 - t0:.6f}", flush=True)


main()
