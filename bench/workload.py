"""The programs the benchmark modes run.

workload: a CPU-bound loop of small Python function calls. Each iteration makes six trace
events: two line events in the loop, then a call, two line events and a return in the callee.
Nothing here allocates beyond small integers, so what a mode adds to the time is what its trace
function costs.

exc_workload: a loop that raises and catches, once in the raising frame and once one frame
out, so that every iteration makes exception events (three: one in raise_here, one in
raise_out and one in the loop's frame) besides its calls, lines and returns. Every exception
is caught: a debugger that stops only on unhandled exceptions must analyse each one and never
stop.
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



def raise_here(i):
    try:
        raise ValueError(i)
    except ValueError:
        return 1


def raise_out(i):
    raise KeyError(i)


def exc_workload(n):
    total = 0
    for i in range(n):
        total += raise_here(i)
        try:
            raise_out(i)
        except KeyError:
            total += 1
    return total
