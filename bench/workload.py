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

gen_workload: generators and a coroutine. Each iteration takes one value from a generator
that delegates to another with `yield from` (both frames resume and suspend), then sends it
into a coroutine driven by `send` (resume, two lines, suspend): call and return events come
from resumed frames, and the delegating frame sees the inner generator's end.

thread_workload: two threads, started here, each running workload(n) at once; the caller
waits for both, so a timed call is the wall time of both. `per_thread`, when given, wraps each
thread's run (a tracer that must be installed thread by thread).
"""

import threading


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


def inner_gen(n):
    for i in range(n):
        yield i
    return n


def outer_gen(n):
    end = yield from inner_gen(n)
    yield end


def accumulator():
    total = 0
    while True:
        value = yield total
        total += value


def gen_workload(n):
    coroutine = accumulator()
    next(coroutine)
    total = 0
    for value in outer_gen(n):
        total = coroutine.send(value)
    coroutine.close()
    return total


# Called at the start and at the end of each thread's run when set: run_bench.py sets it under
# callgrind, whose collection is switched on and off thread by thread.
thread_span = None


def thread_workload(n, per_thread=None):
    def run():
        span = thread_span
        if span is not None:
            span()
        if per_thread is None:
            workload(n)
        else:
            per_thread(workload, n)
        if span is not None:
            span()

    threads = [threading.Thread(target=run) for _ in range(2)]
    for thread in threads:
        thread.start()
    for thread in threads:
        thread.join()
