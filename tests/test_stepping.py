"""Expected-sequence tests of the stepping commands.

Each test runs a small real program in a subprocess under scripted_server.py, answers every
stop with the next command of a script, and compares the stops with the expected list:
("line", file, line, function), ("return", file, line, function, value) and
("exception", file, line, function, exception type name). Every traced run must also print
exactly what an untraced run prints and end with the same exit status.

How the expectations are made: with step_into every line, return and exception event of the
recorded files stops (call events never do), so a step_into sequence is the interpreter's own
event sequence; the other commands keep a stop only where the rules of the command allow:
  step_over            stops in the frame it was given in (line, return and exception
                       events), or anywhere once that frame has left the stack;
  step_over_line(_range)  as step_over, except the frame's events on the given lines;
  step_out             stops at the return of the frame it was given in, then as step_over
                       in its caller (in a frame without caller: at the next event);
  continue_run         no stepping stop at all;
  stop                 the next event anywhere.
Set TRACE_DRY_RUN=1 to print the actual lists.
"""

import sys

from conftest import assert_stops, run_plain, run_traced, write_program

# From 3.12 on, list, dict and set comprehensions run inline in the enclosing frame: no frame,
# no call or return event of their own.
INLINED_COMPREHENSIONS = sys.version_info >= (3, 12)


def line(number, function="<module>", file="prog.py"):
    return ("line", file, number, function)


def ret(number, function, value, file="prog.py"):
    return ("return", file, number, function, value)


def exc(number, function, name, file="prog.py"):
    return ("exception", file, number, function, name)


def trace(tmp_path, source, modules=None, **config):
    """Traces `source` as prog.py (with `modules`, {file name: source}, written next to it)
    and checks that the debugger changed neither its output nor its exit status."""
    program = write_program(tmp_path, source)
    for name, text in (modules or {}).items():
        write_program(tmp_path, text, name)
    run = run_traced(tmp_path, program, **config)
    plain = run_plain(tmp_path, program)
    assert run.stdout == plain.stdout, run.stderr
    assert run.returncode == plain.returncode, run.stderr
    return run


def steps(*commands):
    """A command script: each item is one command, an int n repeats the previous one n
    times in all."""
    script = []
    for item in commands:
        if isinstance(item, int):
            script.extend([script[-1]] * (item - 1))
        else:
            script.append(item)
    return script


# ---- plain functions ---------------------------------------------------------------------

FUNCTIONS = """
def add(a, b):
    total = a + b
    return total

def twice(x):
    y = add(x, x)
    return y

result = twice(2)
print(result)
"""


def test_step_into_stops_at_every_line_and_return(tmp_path):
    run = trace(tmp_path, FUNCTIONS, default="step_into")
    assert run.stdout == "4\n"
    assert_stops(run.stops, [
        line(1), line(5), line(9),
        line(6, "twice"), line(2, "add"), line(3, "add"), ret(3, "add", 4),
        line(7, "twice"), ret(7, "twice", 4),
        line(10), ret(10, "<module>", None),
    ])


def test_step_over_at_module_level_never_stops_in_callees(tmp_path):
    run = trace(tmp_path, FUNCTIONS, default="step_over")
    assert_stops(run.stops, [line(1), line(5), line(9), line(10), ret(10, "<module>", None)])


def test_step_over_in_a_function_stops_at_its_return_then_in_the_caller(tmp_path):
    run = trace(tmp_path, FUNCTIONS, commands=steps("step_into", 3), default="step_over")
    assert_stops(run.stops, [
        line(1), line(5), line(9),
        # step_over from here: add's lines and return belong to a callee.
        line(6, "twice"), line(7, "twice"), ret(7, "twice", 4),
        # twice has left the stack: the next event anywhere stops.
        line(10), ret(10, "<module>", None),
    ])


def test_step_out_stops_at_the_return_then_in_the_caller(tmp_path):
    run = trace(tmp_path, FUNCTIONS,
                commands=steps("step_into", 4, "step_out", "step_out", "step_out", "step_into"))
    assert_stops(run.stops, [
        line(1), line(5), line(9), line(6, "twice"),
        line(2, "add"),          # step_out: line 3 of add does not stop
        ret(3, "add", 4),        # step_out again, from the return event: target twice
        line(7, "twice"),        # step_out of twice
        ret(7, "twice", 4),      # step_into
        line(10),                # continue_run (the default)
    ])


def test_continue_run_stops_nowhere_afterwards(tmp_path):
    run = trace(tmp_path, FUNCTIONS, commands=["step_into", "continue_run"],
                default="step_into")
    assert_stops(run.stops, [line(1), line(5)])


def test_stop_stops_at_the_next_event_anywhere(tmp_path):
    # Unlike step_over, stop at line 6 stops inside the callee add.
    run = trace(tmp_path, FUNCTIONS, commands=steps("step_into", 3, "stop", 4, "continue_run"))
    assert_stops(run.stops, [
        line(1), line(5), line(9),
        line(6, "twice"), line(2, "add"), line(3, "add"), ret(3, "add", 4), line(7, "twice"),
    ])


def test_stop_keeps_a_pending_step_out(tmp_path):
    # exception_mode 1 stops at every exception, so the step_out given at line 8 is
    # interrupted by the KeyError in inner; `stop` there leaves outer as the step-out frame,
    # and every later event stops, outer's return included. (While `stop` is in force every
    # event stops anyway, so the kept step-out frame only shows where stops are otherwise
    # suppressed, as during the import callback.)
    source = """
    def inner():
        try:
            raise KeyError("i")
        except KeyError:
            return 1

    def outer():
        a = 1
        b = inner()
        return a + b

    print(outer())
    """
    run = trace(tmp_path, source, exception_mode=1,
                commands=steps("step_into", 3, "step_out", "stop", 5, "continue_run"))
    assert run.stdout == "2\n"
    assert_stops(run.stops, [
        line(1), line(7), line(12),
        line(8, "outer"),                  # step_out: no line of outer or inner stops...
        exc(3, "inner", "KeyError"),       # ...but the exception does (mode 1): stop
        line(4, "inner"), line(5, "inner"), ret(5, "inner", 1),
        line(10, "outer"), ret(10, "outer", 2),
    ])


# ---- line ranges ---------------------------------------------------------------------------


def test_step_over_line_skips_the_rest_of_a_one_line_loop(tmp_path):
    source = """
    def square(v):
        return v * v

    total = 0
    for i in range(3): total += square(i)
    print(total)
    """
    run = trace(tmp_path, source, default="step_over_line")
    assert run.stdout == "5\n"
    # Every pass of the loop is a line-5 event of the module frame, inside the stepped-over
    # line; square is a callee. The module's return event is on line 6, inside the line
    # stepped over last, so it does not stop either.
    assert_stops(run.stops, [line(1), line(4), line(5), line(6)])


def test_step_over_line_on_a_return_line_does_not_stop_at_the_return(tmp_path):
    run = trace(tmp_path, FUNCTIONS, commands=steps("step_into", 4, "step_over_line", 2))
    assert_stops(run.stops, [
        line(1), line(5), line(9), line(6, "twice"),
        line(2, "add"),    # step_over_line
        line(3, "add"),    # step_over_line: add's return event is on line 3, in the range
        line(7, "twice"),  # add has left the stack
    ])


RANGE = """
def compute(n):
    a = n + 1
    b = a * 2
    c = b - 3
    d = c * c
    return d

x = compute(2)
print(x)
"""


def test_step_over_line_range_skips_those_lines_of_the_stop_frame_only(tmp_path):
    run = trace(tmp_path, RANGE, commands=["step_into", "step_into",
                                           ["step_over_line_range", 3, 4],
                                           ["step_over_line_range", 5, 9]])
    assert run.stdout == "9\n"
    assert_stops(run.stops, [
        line(1), line(8),
        line(2, "compute"),   # range 3..4: lines 3 and 4 run without a stop
        line(5, "compute"),   # range 5..9: line 6 and the return event (line 6) do not stop
        line(9),              # line 9 is in the range, but of compute, which has returned
    ])


def test_step_over_line_range_need_not_hold_the_current_line(tmp_path):
    source = """
    total = 0
    for i in range(3):
        total += i
    print(total)
    """
    run = trace(tmp_path, source, commands=[["step_over_line_range", 3, 3],
                                            ["step_over_line_range", 2, 3]])
    assert run.stdout == "3\n"
    # From line 1 with range 3..3, line 2 is outside and stops; from there range 2..3 covers
    # the whole loop.
    assert_stops(run.stops, [line(1), line(2), line(4)])


# ---- recursion -----------------------------------------------------------------------------

RECURSION = """
def fact(n):
    if n <= 1:
        return 1
    return n * fact(n - 1)

print(fact(3))
"""


def test_step_into_recursion(tmp_path):
    run = trace(tmp_path, RECURSION, default="step_into")
    assert run.stdout == "6\n"
    assert_stops(run.stops, [
        line(1), line(6),
        line(2, "fact"), line(4, "fact"),
        line(2, "fact"), line(4, "fact"),
        line(2, "fact"), line(3, "fact"), ret(3, "fact", 1),
        ret(4, "fact", 2), ret(4, "fact", 6),
        ret(6, "<module>", None),
    ])


def test_step_over_a_recursive_call_skips_the_inner_instances(tmp_path):
    # Same code, other frames: the inner calls are callees of the stop frame.
    run = trace(tmp_path, RECURSION, commands=["step_into", "step_into"], default="step_over")
    assert_stops(run.stops, [
        line(1), line(6), line(2, "fact"), line(4, "fact"), ret(4, "fact", 6),
        ret(6, "<module>", None),
    ])


def test_step_out_of_the_innermost_instance_stops_in_its_calling_instance(tmp_path):
    run = trace(tmp_path, RECURSION,
                commands=steps("step_into", 6, "step_out", "step_out", "continue_run"))
    assert_stops(run.stops, [
        line(1), line(6), line(2, "fact"), line(4, "fact"), line(2, "fact"), line(4, "fact"),
        line(2, "fact"),        # fact(1): step_out
        ret(3, "fact", 1),      # its return; step_out again
        ret(4, "fact", 2),      # fact(2) returns 2: the caller instance, not fact(3)
    ])


# ---- generators -----------------------------------------------------------------------------

GENERATORS = """
def gen(n):
    for i in range(n):
        yield i
    return "done"

def deleg():
    result = yield from gen(2)
    yield result

for v in deleg():
    print(v)
"""

# Each yield is a return event of the generator and of the generator delegating to it; gen's
# `return "done"` reaches deleg as a StopIteration exception event at the `yield from`.
GENERATORS_STEP_INTO = [
    line(1), line(6), line(10),
    line(7, "deleg"), line(2, "gen"), line(3, "gen"), ret(3, "gen", 0), ret(7, "deleg", 0),
    line(11), line(10),
    line(2, "gen"), line(3, "gen"), ret(3, "gen", 1), ret(7, "deleg", 1),
    line(11), line(10),
    line(2, "gen"), line(4, "gen"), ret(4, "gen", "done"),
    exc(7, "deleg", "StopIteration"), line(8, "deleg"), ret(8, "deleg", "done"),
    line(11), line(10),
    ret(8, "deleg", None),       # deleg runs off its end after the last resumption
    ret(10, "<module>", None),
]


def test_step_into_generators_and_yield_from(tmp_path):
    run = trace(tmp_path, GENERATORS, default="step_into")
    assert run.stdout == "0\n1\ndone\n"
    assert_stops(run.stops, GENERATORS_STEP_INTO)


def test_step_over_a_yield_stops_at_the_return_then_where_the_value_goes(tmp_path):
    run = trace(tmp_path, GENERATORS, commands=steps("step_into", 4), default="step_over")
    assert_stops(run.stops, [
        line(1), line(6), line(10), line(7, "deleg"),
        line(2, "gen"), line(3, "gen"),
        ret(3, "gen", 0),        # the yield leaves gen's frame: its return event stops
        ret(7, "deleg", 0),      # gen is off the stack: the next event anywhere stops
        # From here on step_over in the module: resuming deleg and gen is a call.
        line(11), line(10), line(11), line(10), line(11), line(10),
        ret(10, "<module>", None),
    ])


def test_step_out_of_a_finishing_generator(tmp_path):
    run = trace(tmp_path, GENERATORS, commands=steps("step_into", 16, "step_out", "step_out",
                                                     "step_over", 3, "continue_run"))
    assert_stops(run.stops, GENERATORS_STEP_INTO[:17] + [
        # step_out at gen's line 2 (resumed by deleg): line 4 does not stop, the return does
        ret(4, "gen", "done"),
        # step_out again: deleg is the target, and the exception event is in deleg
        exc(7, "deleg", "StopIteration"),
        line(8, "deleg"), ret(8, "deleg", "done"),
        line(11),                # deleg is off the stack
    ])


CLOSED_EARLY = """
def counter():
    try:
        yield 1
        yield 2
    finally:
        print("closing")

for v in counter():
    break
print("after")
"""


def test_step_into_a_generator_closed_early(tmp_path):
    run = trace(tmp_path, CLOSED_EARLY, default="step_into")
    assert run.stdout == "closing\nafter\n"
    assert_stops(run.stops, [
        line(1), line(8), line(2, "counter"), line(3, "counter"), ret(3, "counter", 1),
        line(9),
        # Leaving the loop drops the generator: closing it throws GeneratorExit in at the
        # suspended yield, the finally clause runs, and the frame is left by the exception.
        exc(3, "counter", "GeneratorExit"), line(6, "counter"), ret(6, "counter", None),
        line(10), ret(10, "<module>", None),
    ])


def test_step_over_in_a_generator_closed_early(tmp_path):
    # The close runs while the module frame executes line 9: the generator's events are
    # then a callee's of the module frame, which is the stop frame.
    run = trace(tmp_path, CLOSED_EARLY, commands=["step_into", "step_into"],
                default="step_over")
    assert_stops(run.stops, [
        line(1), line(8), line(2, "counter"), line(3, "counter"), ret(3, "counter", 1),
        line(9), line(10), ret(10, "<module>", None),
    ])


# ---- coroutines -----------------------------------------------------------------------------

COROUTINES = """
import asyncio

async def leaf(x):
    await asyncio.sleep(0)
    return x * 2

async def branch():
    a = await leaf(1)
    b = await leaf(2)
    return a + b

print(asyncio.run(branch()))
"""

# asyncio's own frames are stepped into but not recorded. Awaiting asyncio.sleep(0) suspends
# the chain: leaf and branch return None (their suspension); on resumption sleep's result
# arrives in leaf as StopIteration, and leaf's result in branch the same way.
COROUTINES_AFTER_FIRST_SUSPENSION = [
    exc(4, "leaf", "StopIteration"), line(5, "leaf"), ret(5, "leaf", 2),
    exc(8, "branch", "StopIteration"),
    line(9, "branch"), line(4, "leaf"), ret(4, "leaf", None), ret(9, "branch", None),
    exc(4, "leaf", "StopIteration"), line(5, "leaf"), ret(5, "leaf", 4),
    exc(9, "branch", "StopIteration"),
    line(10, "branch"), ret(10, "branch", 6),
    ret(12, "<module>", None),
]


def test_step_into_coroutines(tmp_path):
    run = trace(tmp_path, COROUTINES, default="step_into", when_elsewhere="step_into")
    assert run.stdout == "6\n"
    assert_stops(run.stops, [
        line(1), line(3), line(7), line(12),
        line(8, "branch"), line(4, "leaf"), ret(4, "leaf", None), ret(8, "branch", None),
    ] + COROUTINES_AFTER_FIRST_SUSPENSION)


def test_step_over_an_await_that_suspends_stops_at_the_suspension(tmp_path):
    # Module level: stepping over `import asyncio` runs the import as a callee. In branch,
    # leaf is a callee; branch's own return event (the suspension) stops. Then asyncio's
    # frames take over (not recorded, answered with step_into).
    run = trace(tmp_path, COROUTINES, commands=steps("step_over", 3, "step_into", "step_over"),
                default="step_into")
    assert_stops(run.stops, [
        line(1), line(3), line(7), line(12),
        line(8, "branch"), ret(8, "branch", None),
    ] + COROUTINES_AFTER_FIRST_SUSPENSION)


def test_step_over_an_await_that_completes_stops_at_its_stop_iteration(tmp_path):
    # quick() returns without suspending; its result reaches branch as a StopIteration
    # exception event, and exception events of the stepped frame stop.
    source = """
    import asyncio

    async def quick():
        return 2

    async def branch():
        a = await quick()
        return a

    print(asyncio.run(branch()))
    """
    run = trace(tmp_path, source, commands=steps("step_over", 3, "step_into", "step_over", 3),
                default="step_into")
    assert run.stdout == "2\n"
    assert_stops(run.stops, [
        line(1), line(3), line(6), line(10),
        line(7, "branch"), exc(7, "branch", "StopIteration"), line(8, "branch"),
        ret(8, "branch", 2),
        ret(10, "<module>", None),
    ])


# ---- lambdas, comprehensions, decorators, classes, with ------------------------------------

LAMBDAS = """
double = lambda v: v * 2
values = list(map(double, [1, 2]))
print(values)
"""


def test_step_into_lambdas(tmp_path):
    run = trace(tmp_path, LAMBDAS, default="step_into")
    assert run.stdout == "[2, 4]\n"
    assert_stops(run.stops, [
        line(1), line(2),
        line(1, "<lambda>"), ret(1, "<lambda>", 2), line(1, "<lambda>"), ret(1, "<lambda>", 4),
        line(3), ret(3, "<module>", None),
    ])


def test_step_over_a_line_calling_lambdas(tmp_path):
    run = trace(tmp_path, LAMBDAS, default="step_over")
    assert_stops(run.stops, [line(1), line(2), line(3), ret(3, "<module>", None)])


COMPREHENSIONS = """
def sq(v):
    return v * v

squares = [sq(i) for i in range(2)]
table = {i: i for i in range(2)}
seen = {i for i in range(2)}
print(squares, table, seen)
"""


def test_step_into_comprehensions(tmp_path):
    run = trace(tmp_path, COMPREHENSIONS, default="step_into")
    assert run.stdout == "[0, 1] {0: 0, 1: 1} {0, 1}\n"
    if INLINED_COMPREHENSIONS:
        # The loop runs in the module frame: line 4 on arrival, then once per jump back to
        # the loop head (after each of the two items).
        expected = [
            line(1), line(4),
            line(2, "sq"), ret(2, "sq", 0), line(4), line(2, "sq"), ret(2, "sq", 1), line(4),
            line(5), line(5), line(5),
            line(6), line(6), line(6),
            line(7), ret(7, "<module>", None),
        ]
    else:
        # Each comprehension is a frame of its own: a line event on entry, one per jump
        # back to the loop head, and a return event with the built object.
        expected = [
            line(1), line(4),
            line(4, "<listcomp>"), line(2, "sq"), ret(2, "sq", 0),
            line(4, "<listcomp>"), line(2, "sq"), ret(2, "sq", 1),
            line(4, "<listcomp>"), ret(4, "<listcomp>", "list"),
            line(5), line(5, "<dictcomp>"), line(5, "<dictcomp>"), line(5, "<dictcomp>"),
            ret(5, "<dictcomp>", "dict"),
            line(6), line(6, "<setcomp>"), line(6, "<setcomp>"), line(6, "<setcomp>"),
            ret(6, "<setcomp>", "set"),
            line(7), ret(7, "<module>", None),
        ]
    assert_stops(run.stops, expected)


def test_step_over_comprehensions(tmp_path):
    run = trace(tmp_path, COMPREHENSIONS, default="step_over")
    if INLINED_COMPREHENSIONS:
        # The jumps back to the loop head are line events of the stop frame itself.
        expected = [line(1), line(4), line(4), line(4), line(5), line(5), line(5),
                    line(6), line(6), line(6), line(7), ret(7, "<module>", None)]
    else:
        expected = [line(1), line(4), line(5), line(6), line(7), ret(7, "<module>", None)]
    assert_stops(run.stops, expected)


def test_step_over_line_steps_over_a_comprehension_on_every_version(tmp_path):
    run = trace(tmp_path, COMPREHENSIONS, commands=["step_over"], default="step_over_line")
    # The last step_over_line covers the module's return event on line 7.
    assert_stops(run.stops, [line(1), line(4), line(5), line(6), line(7)])


def test_step_out_of_a_function_called_by_a_comprehension(tmp_path):
    if INLINED_COMPREHENSIONS:
        # sq's caller is the module frame itself. A step_out there leaves the module frame:
        # the second call of sq and the module's remaining lines are its callee's and its
        # own events, and only its return stops.
        commands = ["step_into", "step_into", "step_out", "step_out", "step_out"]
        expected = [line(1), line(4), line(2, "sq"), ret(2, "sq", 0), line(4),
                    ret(7, "<module>", None)]
    else:
        # sq's caller is the <listcomp> frame; stepping out of that lands in the module.
        commands = ["step_into", "step_into", "step_into"] + ["step_out"] * 4
        expected = [line(1), line(4), line(4, "<listcomp>"), line(2, "sq"), ret(2, "sq", 0),
                    line(4, "<listcomp>"), ret(4, "<listcomp>", "list"), line(5)]
    run = trace(tmp_path, COMPREHENSIONS, commands=commands)
    assert_stops(run.stops, expected)


DECORATORS = """
def logged(fn):
    def wrapper(*args):
        result = fn(*args)
        return result
    return wrapper

@logged
def square(x):
    return x * x

print(square(3))
"""


def test_step_into_decorators(tmp_path):
    run = trace(tmp_path, DECORATORS, default="step_into")
    assert run.stdout == "9\n"
    assert_stops(run.stops, [
        line(1),
        # The decorator expression (7) is evaluated before the function is made (8) and
        # called after; binding the name belongs to line 8 again.
        line(7), line(8), line(7),
        line(2, "logged"), line(5, "logged"), ret(5, "logged", "function"),
        line(8), line(11),
        line(3, "wrapper"), line(9, "square"), ret(9, "square", 9),
        line(4, "wrapper"), ret(4, "wrapper", 9),
        ret(11, "<module>", None),
    ])


def test_step_over_in_a_decorator_wrapper_skips_the_wrapped_function(tmp_path):
    run = trace(tmp_path, DECORATORS, commands=steps("step_into", 9), default="step_over")
    assert_stops(run.stops, [
        line(1), line(7), line(8), line(7),
        line(2, "logged"), line(5, "logged"), ret(5, "logged", "function"),
        line(8), line(11),
        line(3, "wrapper"), line(4, "wrapper"), ret(4, "wrapper", 9),
        ret(11, "<module>", None),
    ])


CLASSES = """
class Counter:
    start = 10

    def __init__(self):
        self.n = Counter.start

    def bump(self):
        self.n += 1
        return self.n

c = Counter()
print(c.bump())
"""


def test_step_into_a_class_body_and_methods(tmp_path):
    run = trace(tmp_path, CLASSES, default="step_into")
    assert run.stdout == "11\n"
    assert_stops(run.stops, [
        line(1),
        # The class body is a frame named after the class; its statements are the
        # assignment and the two `def`s; it returns None (the namespace is its locals).
        line(1, "Counter"), line(2, "Counter"), line(4, "Counter"), line(7, "Counter"),
        ret(7, "Counter", None),
        line(11), line(5, "__init__"), ret(5, "__init__", None),
        line(12), line(8, "bump"), line(9, "bump"), ret(9, "bump", 11),
        ret(12, "<module>", None),
    ])


def test_step_over_a_class_statement(tmp_path):
    run = trace(tmp_path, CLASSES, default="step_over")
    assert_stops(run.stops, [line(1), line(11), line(12), ret(12, "<module>", None)])


WITH_BLOCK = """
class Managed:
    def __enter__(self):
        print("enter")
        return self

    def __exit__(self, *exc):
        print("exit", exc[0] is None)
        return False

with Managed() as m:
    print("body")
print("after")
"""


def test_step_into_a_with_block(tmp_path):
    run = trace(tmp_path, WITH_BLOCK, default="step_into")
    assert run.stdout == "enter\nbody\nexit True\nafter\n"
    assert_stops(run.stops, [
        line(1), line(1, "Managed"), line(2, "Managed"), line(6, "Managed"),
        ret(6, "Managed", None),
        line(10), line(3, "__enter__"), line(4, "__enter__"), ret(4, "__enter__", "Managed"),
        line(11),
        line(10),    # leaving the block: the call of __exit__ belongs to the `with` line
        line(7, "__exit__"), line(8, "__exit__"), ret(8, "__exit__", False),
        line(12), ret(12, "<module>", None),
    ])


def test_step_over_a_with_block(tmp_path):
    run = trace(tmp_path, WITH_BLOCK, default="step_over")
    assert_stops(run.stops, [line(1), line(10), line(11), line(10), line(12),
                             ret(12, "<module>", None)])


def test_step_into_a_with_block_that_swallows_an_exception(tmp_path):
    source = """
    class Quiet:
        def __enter__(self):
            return self

        def __exit__(self, kind, value, tb):
            print("exit", kind.__name__)
            return True

    with Quiet():
        raise ValueError("inside")
    print("after")
    """
    run = trace(tmp_path, source, default="step_into")
    assert run.stdout == "exit ValueError\nafter\n"
    assert_stops(run.stops, [
        line(1), line(1, "Quiet"), line(2, "Quiet"), line(5, "Quiet"), ret(5, "Quiet", None),
        line(9), line(3, "__enter__"), ret(3, "__enter__", "Quiet"),
        line(10), exc(10, "<module>", "ValueError"),
        line(9), line(6, "__exit__"), line(7, "__exit__"), ret(7, "__exit__", True),
        line(11), ret(11, "<module>", None),
    ])


# ---- exceptions -----------------------------------------------------------------------------

EXCEPTIONS = """
def fail(n):
    raise ValueError(n)

def middle(n):
    fail(n)
    return "unreached"

def top():
    try:
        middle(1)
    except ValueError as e:
        return str(e)
    finally:
        print("cleanup")

print(top())
"""


def test_step_into_an_exception_propagating_out_of_frames(tmp_path):
    run = trace(tmp_path, EXCEPTIONS, default="step_into")
    assert run.stdout == "cleanup\n1\n"
    assert_stops(run.stops, [
        line(1), line(4), line(8), line(16),
        line(9, "top"), line(10, "top"), line(5, "middle"), line(2, "fail"),
        # Each frame the exception passes through reports it, then returns without a
        # value: the core hands the return callback None for a frame left by an exception.
        exc(2, "fail", "ValueError"), ret(2, "fail", None),
        exc(5, "middle", "ValueError"), ret(5, "middle", None),
        exc(10, "top", "ValueError"),
        line(11, "top"), line(12, "top"), line(14, "top"), ret(14, "top", "1"),
        ret(16, "<module>", None),
    ])


def test_step_over_stops_at_an_exception_arriving_in_the_stop_frame(tmp_path):
    run = trace(tmp_path, EXCEPTIONS, commands=steps("step_into", 4), default="step_over")
    assert_stops(run.stops, [
        line(1), line(4), line(8), line(16),
        line(9, "top"), line(10, "top"),
        # fail's and middle's events are a callee's; the exception event in top is not.
        exc(10, "top", "ValueError"),
        line(11, "top"), line(12, "top"), line(14, "top"), ret(14, "top", "1"),
        ret(16, "<module>", None),
    ])


def test_step_out_of_frames_left_by_an_exception(tmp_path):
    run = trace(tmp_path, EXCEPTIONS, commands=steps("step_into", 7, "step_out", 4,
                                                     "continue_run"))
    assert_stops(run.stops, [
        line(1), line(4), line(8), line(16), line(9, "top"), line(10, "top"),
        line(5, "middle"),
        line(2, "fail"),                # step_out: fail's exception event does not stop
        ret(2, "fail", None),           # its return does; step_out again: target middle
        exc(5, "middle", "ValueError"),  # step_out of middle
        ret(5, "middle", None),         # step_out again: target top
        exc(10, "top", "ValueError"),
    ])


def test_step_over_line_does_not_stop_at_an_exception_arriving_on_that_line(tmp_path):
    # As with its line events, the stop frame's exception event on line 10 is inside the
    # range; the `except` line is not.
    run = trace(tmp_path, EXCEPTIONS, commands=steps("step_into", 5, "step_over_line", 3))
    assert_stops(run.stops, [
        line(1), line(4), line(8), line(16), line(9, "top"),
        line(10, "top"), line(11, "top"), line(12, "top"), line(14, "top"),
    ])


def test_always_stop_mode_stops_in_a_stepped_over_callee(tmp_path):
    # exception_mode 1 stops at every exception event, whatever the stepping command; the
    # stepping state then continues from the frame of that stop.
    run = trace(tmp_path, EXCEPTIONS, exception_mode=1,
                commands=steps("step_into", 4, "step_over", 4))
    assert_stops(run.stops, [
        line(1), line(4), line(8), line(16),
        line(9, "top"), line(10, "top"),   # step_over at line 10...
        exc(2, "fail", "ValueError"),      # ...but mode 1 stops here; step_over in fail
        ret(2, "fail", None),              # fail's own return; step_over
        exc(5, "middle", "ValueError"),    # fail is gone: next event anywhere; continue_run
        exc(10, "top", "ValueError"),      # continue_run does not silence mode 1
    ])


def test_continue_run_does_not_stop_at_exceptions(tmp_path):
    run = trace(tmp_path, EXCEPTIONS, commands=["continue_run"], default="step_into")
    assert_stops(run.stops, [line(1)])


def test_step_into_an_exception_that_ends_the_program(tmp_path):
    source = """
    def boom():
        raise KeyError("k")

    print("before")
    boom()
    print("after")
    """
    run = trace(tmp_path, source, default="step_into")
    assert run.returncode == 1
    assert run.stdout == "before\n"
    assert "KeyError: 'k'" in run.stderr
    assert_stops(run.stops, [
        line(1), line(4), line(5), line(2, "boom"),
        exc(2, "boom", "KeyError"), ret(2, "boom", None),
        exc(5, "<module>", "KeyError"), ret(5, "<module>", None),
    ])


def test_step_into_sys_exit_keeps_the_exit_status(tmp_path):
    source = """
    import sys

    def finish(code):
        print("finishing")
        sys.exit(code)

    finish(3)
    print("not reached")
    """
    run = trace(tmp_path, source, default="step_into")
    assert run.returncode == 3
    assert run.stdout == "finishing\n"
    assert_stops(run.stops, [
        line(1), line(3), line(7),
        line(4, "finish"), line(5, "finish"),
        exc(5, "finish", "SystemExit"), ret(5, "finish", None),
        exc(7, "<module>", "SystemExit"), ret(7, "<module>", None),
    ])


# ---- a module imported while the program runs ----------------------------------------------

IMPORTER = """
print("start")
import helper
print(helper.twice(4))
"""

HELPER = """
FACTOR = 2

def twice(x):
    return x * FACTOR
"""


def test_step_into_a_module_imported_mid_run(tmp_path):
    # The import machinery's frames are stepped through without being recorded.
    run = trace(tmp_path, IMPORTER, modules={"helper.py": HELPER},
                files=["prog.py", "helper.py"], default="step_into")
    assert run.stdout == "start\n8\n"
    assert_stops(run.stops, [
        line(1), line(2),
        line(1, file="helper.py"), line(3, file="helper.py"),
        ret(3, "<module>", None, file="helper.py"),
        line(3),
        line(4, "twice", file="helper.py"), ret(4, "twice", 8, file="helper.py"),
        ret(3, "<module>", None),
    ])


def test_step_over_an_import_statement(tmp_path):
    run = trace(tmp_path, IMPORTER, modules={"helper.py": HELPER},
                files=["prog.py", "helper.py"], default="step_over")
    assert_stops(run.stops, [line(1), line(2), line(3), ret(3, "<module>", None)])


EXECUTED = """
source = "def inner(v):\\n    return v + 1\\nresult = inner(1)\\n"
ns = {}
exec(compile(source, "<generated>", "exec"), ns)
print(ns["result"])
"""


def test_step_into_code_run_by_exec(tmp_path):
    # A name of its own: the standard library runs "<string>" code (namedtuple) at start-up.
    run = trace(tmp_path, EXECUTED, files=["prog.py", "<generated>"], default="step_into")
    assert run.stdout == "2\n"
    assert_stops(run.stops, [
        line(1), line(2), line(3),
        line(1, file="<generated>"), line(3, file="<generated>"),
        line(2, "inner", file="<generated>"), ret(2, "inner", 2, file="<generated>"),
        ret(3, "<module>", None, file="<generated>"),
        line(4), ret(4, "<module>", None),
    ])


def test_step_over_an_exec_call(tmp_path):
    run = trace(tmp_path, EXECUTED, files=["prog.py", "<generated>"], default="step_over")
    assert_stops(run.stops, [line(1), line(2), line(3), line(4), ret(4, "<module>", None)])


def test_stepping_in_one_thread_never_stops_another(tmp_path):
    # The stepping state belongs to the thread that was given the command: the worker's
    # record starts running freely, so step_into in the main thread stops only there.
    source = """
    import threading

    def work():
        total = 0
        for i in range(3):
            total += i
        print("worker", total)

    t = threading.Thread(target=work)
    t.start()
    t.join()
    print("main")
    """
    run = trace(tmp_path, source, default="step_into", record_threads=True)
    assert run.stdout == "worker 3\nmain\n"
    assert_stops(run.stops, [stop + ("main",) for stop in [
        line(1), line(3), line(9), line(10), line(11), line(12), ret(12, "<module>", None),
    ]])


# ---- the bottom frame ------------------------------------------------------------------------


def test_step_out_in_the_bottom_frame_stops_at_the_next_event(tmp_path):
    # A raw thread runs worker with no Python caller: worker is the bottom frame of its
    # thread (line 17 prints that it has no caller). It turns on the thread hook the server side installed (as a raw thread must),
    # and the call of hop starts tracing it. Its thread record starts running freely, so the
    # first stop is the KeyError (exception_mode 1); step_out there has no caller to go to,
    # so the next event anywhere stops: the `except` line.
    source = """
    import _thread
    import sys
    import threading

    done = threading.Event()

    def hop():
        return "hop"

    def worker():
        sys.settrace(threading.gettrace())
        hop()
        try:
            raise KeyError("w")
        except KeyError:
            hop()
        print("bottom", sys._getframe().f_back is None)
        done.set()

    _thread.start_new_thread(worker, ())
    done.wait()
    print("end")
    """
    run = trace(tmp_path, source, exception_mode=1, when_elsewhere="continue_run",
                commands=["step_out", "step_over", "step_over", "continue_run"])
    assert run.stdout == "bottom True\nend\n"
    assert_stops(run.stops, [
        exc(14, "worker", "KeyError"),
        line(15, "worker"),     # step_over: worker is both the stop frame and the bottom
        line(16, "worker"),     # frame; hop, its callee, must not stop
        line(17, "worker"),     # continue_run: the thread runs on freely
    ])
