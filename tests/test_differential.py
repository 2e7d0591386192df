"""Differential tests: the interpreter is the judge of where a program's lines run.

Each program runs twice: once under the core, answering every stop with step_into and
recording stops in every file (all_files) except the scripted server's own, and once under
line_recorder.py, a plain sys.settrace function that records every line event. Both run the
program the same way (runpy.run_path as __main__, the program's folder first on sys.path),
so the list of line stops must be exactly the list of line events, in the same order,
standard library and import machinery included. The return and exception stops of the
traced run are left out of the comparison.
"""

import difflib
import sys

import pytest

from conftest import record_lines, run_plain, run_traced, write_program

CONTROL_FLOW = """
def classify(n):
    if n < 0:
        return "neg"
    elif n == 0:
        return "zero"
    return "pos"


def scan(values):
    found = []
    i = 0
    while True:
        if i >= len(values):
            break
        v = values[i]
        i += 1
        if v is None:
            continue
        try:
            found.append(10 // v)
        except ZeroDivisionError:
            found.append("div0")
        else:
            found.append(classify(v))
        finally:
            found.append("|")
    for label in ("a", "b"):
        for k in range(3):
            if k == 1:
                continue
            if label == "b" and k == 2:
                break
            found.append(label + str(k))
    else:
        found.append("loops done")
    total = 0
    n = 5
    while n:
        n -= 1
        if n % 2:
            continue
        total += n
    else:
        found.append(total)
    return found


def nested_finally():
    log = []
    for attempt in range(2):
        try:
            try:
                if attempt:
                    raise KeyError(attempt)
                log.append("ok")
            finally:
                log.append("inner")
        except KeyError as e:
            log.append(f"caught {e}")
    return log


print(scan([3, None, 0, -2, 5]))
print(nested_finally())
flag = any(x > 3 for x in [1, 5])
print(flag, classify(-1), classify(0))
"""

RECURSION = """
import sys


def fib(n, memo={}):
    if n in memo:
        return memo[n]
    if n < 2:
        result = n
    else:
        result = fib(n - 1) + fib(n - 2)
    memo[n] = result
    return result


def is_even(n):
    return True if n == 0 else is_odd(n - 1)


def is_odd(n):
    return False if n == 0 else is_even(n - 1)


def hanoi(n, src, dst, via, moves):
    if n == 0:
        return moves
    hanoi(n - 1, src, via, dst, moves)
    moves.append((src, dst))
    return hanoi(n - 1, via, dst, src, moves)


def deep(n):
    if n == 0:
        raise RecursionError("bottom")
    return deep(n - 1)


print(fib(12), is_even(7), len(hanoi(4, "a", "c", "b", [])))
try:
    deep(20)
except RecursionError as e:
    print("caught", e)
"""

GENERATORS = """
def numbers(limit):
    n = 0
    while n < limit:
        yield n
        n += 1
    return "exhausted"


def evens(source):
    for value in source:
        if value % 2 == 0:
            yield value


def relay():
    outcome = yield from numbers(3)
    yield outcome


def accumulator():
    total = 0
    try:
        while True:
            received = yield total
            if received is None:
                break
            total += received
    except GeneratorExit:
        print("closed at", total)
        raise
    finally:
        print("finally", total)


print(list(evens(numbers(7))))
print(list(relay()))
acc = accumulator()
next(acc)
acc.send(4)
acc.send(5)
try:
    acc.throw(ValueError("stop"))
except ValueError as e:
    print("thrown back", e)
acc2 = accumulator()
next(acc2)
acc2.send(1)
acc2.close()
print(sum(x * x for x in numbers(4)))
it = numbers(1)
print(next(it), next(it, "end"))
"""

PROPERTIES = """
class Temperature:
    scale = "C"

    def __init__(self, celsius):
        self._celsius = celsius

    @property
    def celsius(self):
        return self._celsius

    @celsius.setter
    def celsius(self, value):
        if value < -273.15:
            raise ValueError("below absolute zero")
        self._celsius = value

    @celsius.deleter
    def celsius(self):
        self._celsius = 0.0

    @property
    def fahrenheit(self):
        return self._celsius * 9 / 5 + 32

    @classmethod
    def from_fahrenheit(cls, f):
        return cls((f - 32) * 5 / 9)

    @staticmethod
    def describe(value):
        return f"{value:.1f}"

    def __repr__(self):
        return f"Temperature({self.describe(self._celsius)})"


class Kelvin(Temperature):
    @property
    def celsius(self):
        return super().celsius - 273.15

    def __eq__(self, other):
        return isinstance(other, Temperature) and self._celsius == other._celsius

    __hash__ = None


t = Temperature(20)
t.celsius = 25
print(t.celsius, t.fahrenheit, t)
try:
    t.celsius = -300
except ValueError as e:
    print("rejected:", e)
del t.celsius
print(Temperature.from_fahrenheit(212), Kelvin(300).celsius, Kelvin(1) == Kelvin(1))
print(sorted([Temperature(3), Temperature(1)], key=lambda x: x.celsius))
"""

JSON = """
import json

data = {
    "name": "probe",
    "values": [1, 2.5, None, True, {"nested": ["a", "b", {"deep": []}]}],
    "empty": {},
    "text": "line\\nbreak \\u00e9",
}
encoded = json.dumps(data, indent=2, sort_keys=True)
decoded = json.loads(encoded)
print(decoded == data, len(encoded))
print(json.dumps([1, [2, [3]]], separators=(",", ":")))
try:
    json.loads('{"a": }')
except json.JSONDecodeError as e:
    print("bad json at", e.pos)
"""

TEXTWRAP = """
import textwrap

text = ("The debugger core decides, event by event, whether the program must stop; "
        "this sentence is long enough to be wrapped several times over.")
print(textwrap.fill(text, width=30))
print(textwrap.shorten(text, width=40, placeholder=" ..."))
print(textwrap.indent(textwrap.dedent('''
    first
      second
'''), "> "))
"""

HEAPQ = """
import heapq

heap = []
for value in [5, 1, 8, 3, 9, 2]:
    heapq.heappush(heap, value)
print([heapq.heappop(heap) for _ in range(3)])
print(heapq.nlargest(2, [4, 7, 1, 9]), heapq.nsmallest(2, [4, 7, 1, 9], key=lambda v: -v))
print(list(heapq.merge([1, 4, 7], [2, 5, 8], [3, 6])))
"""

FRACTIONS = """
from fractions import Fraction

a = Fraction(3, 4)
b = Fraction("1/6")
print(a + b, a * b, a / b, a - b, a ** 2)
print(Fraction(0.125), Fraction("2.5").limit_denominator(10), round(Fraction(7, 3), 1))
print(sum(Fraction(1, n) for n in range(1, 5)), a < b, a == Fraction(6, 8))
"""

TEMPLATE = """
from string import Template


class Angle(Template):
    delimiter = "%"


t = Template("$who likes ${what}; $$5")
print(t.substitute(who="tim", what="kung pao"))
print(t.safe_substitute(who="ann"))
try:
    t.substitute(who="x")
except KeyError as e:
    print("missing", e)
print(Angle("%a and %{b}").substitute(a=1, b=2))
"""

DATACLASSES = """
import dataclasses
import functools


@dataclasses.dataclass(order=True)
class Point:
    x: int
    y: int = 0

    def norm(self):
        return abs(self.x) + abs(self.y)


@functools.lru_cache(maxsize=None)
def cost(n):
    return n if n < 2 else cost(n - 1) + cost(n - 2)


points = sorted([Point(3, 1), Point(1, 2), Point(1)])
print(points, [p.norm() for p in points], cost(15))
print(dataclasses.asdict(points[0]), dataclasses.replace(points[1], y=9))
"""

PROGRAMS = {
    "control_flow": CONTROL_FLOW,
    "recursion": RECURSION,
    "generators": GENERATORS,
    "properties": PROPERTIES,
    "json": JSON,
    "textwrap": TEXTWRAP,
    "heapq": HEAPQ,
    "fractions": FRACTIONS,
    "string_template": TEMPLATE,
    "dataclasses": DATACLASSES,
}


def line_stops(run):
    return [tuple(stop[1:4]) for stop in run.stops if stop[0] == "line"]


@pytest.mark.parametrize("name", sorted(PROGRAMS))
def test_line_stops_are_the_interpreters_line_events(tmp_path, name):
    program = write_program(tmp_path, PROGRAMS[name])
    expected = record_lines(tmp_path, program)
    run = run_traced(tmp_path, program, all_files=True, default="step_into")
    plain = run_plain(tmp_path, program)
    assert (run.returncode, run.stdout) == (plain.returncode, plain.stdout), run.stderr
    assert run.returncode == 0, run.stderr
    actual = line_stops(run)
    # The program's own lines must be there: an empty recording would compare equal too.
    assert any(file == "prog.py" for file, _, _ in actual)
    if actual != expected:
        diff = difflib.unified_diff([repr(e) for e in expected], [repr(a) for a in actual],
                                    "sys.settrace", "core", lineterm="", n=2)
        pytest.fail("line stops differ from the interpreter's line events:\n"
                    + "\n".join(list(diff)[:80]))
