"""The program every benchmark mode runs: a CPU-bound loop of small Python function calls.

Each iteration makes six trace events: two line events in the loop, then a call, two line
events and a return in the callee. Nothing here allocates beyond small integers, so what a
mode adds to the time is what its trace function costs.
"""


def leaf(x):
    y = x * 3
    return y + 1


def workload(n):
    total = 0
    for i in range(n):
        total += leaf(i)
    return total


def never_called():
    # The debuggers that drop tracing when no breakpoint is set get one here: a line that
    # the workload never reaches, in the workload's own file.
    return None

