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

UNITTEST = """
import io
import unittest


def chunks(seq, size):
    for start in range(0, len(seq), size):
        yield seq[start:start + size]


class ChunkTests(unittest.TestCase):
    def test_sizes(self):
        self.assertEqual([len(c) for c in chunks("abcdefg", 3)], [3, 3, 1])

    def test_raises(self):
        with self.assertRaises(ZeroDivisionError):
            1 / 0

    def test_subtests(self):
        for size in (1, 2):
            with self.subTest(size=size):
                self.assertTrue(all(chunks("ab", size)))

    def test_failure_is_reported(self):
        self.assertEqual(list(chunks("", 2)), ["never"])


stream = io.StringIO()
result = unittest.TextTestRunner(stream=stream, verbosity=0).run(
    unittest.defaultTestLoader.loadTestsFromTestCase(ChunkTests))
print(result.testsRun, len(result.failures), len(result.errors))
"""

LOGGING_ARGPARSE = """
import argparse
import io
import logging

parser = argparse.ArgumentParser(prog="tool")
parser.add_argument("--level", choices=["info", "warning"], default="info")
parser.add_argument("-n", type=int, default=1)
parser.add_argument("names", nargs="*")
args = parser.parse_args(["--level", "warning", "-n", "2", "a", "b"])

buffer = io.StringIO()
handler = logging.StreamHandler(buffer)
handler.setFormatter(logging.Formatter("%(levelname)s:%(name)s:%(message)s"))
log = logging.getLogger("probe")
log.addHandler(handler)
log.setLevel(args.level.upper())
for name in args.names * args.n:
    log.info("skipped %s", name)
    log.warning("kept %s", name)
try:
    parser.parse_args(["-n", "x"])
except SystemExit as e:
    print("usage error", e.code)
print(buffer.getvalue(), end="")
"""

LANGUAGE_FEATURES = """
import asyncio
import contextlib
import functools
import sys
import weakref


def describe(value):
    match value:
        case {"kind": "point", "x": x, "y": y} if x == y:
            return f"diagonal {x}"
        case [first, *rest]:
            return f"list starting {first} plus {len(rest)}"
        case int(n) | float(n) if n < 0:
            return "negative"
        case str() as s:
            return "text " + s
        case _:
            return "other"


def groups():
    try:
        raise ExceptionGroup("many", [ValueError(1), KeyError(2), TypeError(3)])
    except* ValueError as eg:
        print("values", len(eg.exceptions))
    except* (KeyError, TypeError) as eg:
        print("others", len(eg.exceptions))


def finally_return():
    for i in range(3):
        try:
            if i == 1:
                return i
        finally:
            if i == 1:
                print("finally on return")


class Meta(type):
    def __new__(mcls, name, bases, ns):
        ns["made_by"] = "Meta"
        return super().__new__(mcls, name, bases, ns)


class Base(metaclass=Meta):
    registry = []

    def __init_subclass__(cls, **kwargs):
        super().__init_subclass__(**kwargs)
        Base.registry.append(cls.__name__)

    def __getattr__(self, name):
        return f"missing {name}"


class Child(Base):
    @property
    def broken(self):
        raise AttributeError("no")


class Writer:
    def __init__(self):
        self.parts = []

    def write(self, text):
        self.parts.append(text)


class Noisy:
    def __del__(self):
        print("deleted")


async def ticker(n):
    for i in range(n):
        await asyncio.sleep(0)
        yield i


@contextlib.asynccontextmanager
async def opened():
    yield "res"


async def gathered():
    async with opened() as r:
        values = [v async for v in ticker(2)]
    results = await asyncio.gather(asyncio.sleep(0, "a"), asyncio.sleep(0, "b"))
    async with asyncio.TaskGroup() as tg:
        task = tg.create_task(asyncio.sleep(0, "c"))
    return r, values, results, task.result()


def counter_factory():
    count = 0

    def bump():
        nonlocal count
        count += 1
        return count
    return bump


print([describe(v) for v in [{"kind": "point", "x": 1, "y": 1}, [1, 2, 3], -2, "s", None]])
groups()
print(finally_return())
c = Child()
print(c.made_by, Base.registry, c.anything, c.broken)
w = Writer()
print("to writer", file=w)
print(w.parts)
n = Noisy()
del n
f = weakref.finalize(Writer(), print, "finalized")
print(asyncio.run(gathered()))
bump = counter_factory()
bump(); bump()
print(bump(), functools.reduce(lambda a, b: a * b, range(1, 6)), sorted("bca", key=lambda ch: -ord(ch)))
if (n := len(sys.argv)) > 0 and 0 < n < 5:
    print("walrus", n)
with contextlib.ExitStack() as stack:
    stack.callback(print, "exit stack")
    with contextlib.suppress(KeyError):
        {}["k"]
first, *middle, last = range(5)
print(first, middle, last, 1 < first + 1 < 3)
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
    "unittest": UNITTEST,
    "logging_argparse": LOGGING_ARGPARSE,
    # match, except*, finally on return, metaclasses, __getattr__ fallbacks, Python code
    # called from C (print to a writer, __del__, sort keys, weakref.finalize), async
    # generators, async context managers, gather and TaskGroup, closures, walrus.
    "language_features": LANGUAGE_FEATURES,
}


def line_stops(run):
    return [tuple(stop[1:4]) for stop in run.stops if stop[0] == "line"]


@pytest.mark.parametrize("name", sorted(PROGRAMS))
def test_line_stops_are_the_interpreters_line_events(tmp_path, monkeypatch, name):
    # Both runs must take the same paths through code that iterates over sets and dicts of
    # strings: one fixed hash seed for both.
    monkeypatch.setenv("PYTHONHASHSEED", "0")
    program = write_program(tmp_path, PROGRAMS[name])
    expected = record_lines(tmp_path, program)
    run = run_traced(tmp_path, program, all_files=True, default="step_into",
                     max_stops=10_000_000)
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
