"""The evaluation of simple conditions without the eval loop, against the compiled code.

A condition is evaluated by the core in a frame of this process through
tvantrel30pydebugstackless.breakpoints.condition_answers, which gives the hit test's answer
and the answer of the fast path alone. For every condition of the table and every value of
its operands, the hit test must answer what Python's own eval answers in the frame's globals
and a copy of its locals (None when that raises); the fast path must answer the same or
nothing; it must answer for operands of exact built-in types, and never for subclasses or
objects with comparisons of their own (those are compared by their own code exactly once per
evaluation, as the compiled code compares them).
"""

import math
import sys
import types

import pytest

import tvantrel30pydebugstackless
from tvantrel30pydebugstackless import breakpoints


class IntSub(int):
    pass


class StrSub(str):
    pass


class Counted:
    """Counts its comparisons; equal to nothing."""
    calls = 0

    def __eq__(self, other):
        Counted.calls += 1
        return False

    __hash__ = object.__hash__


class EqRaises:
    def __eq__(self, other):
        raise RuntimeError("no comparison")

    __hash__ = object.__hash__


class Holder:
    def __init__(self, value):
        self.attr = value


class Prop:
    calls = 0

    @property
    def attr(self):
        Prop.calls += 1
        return 1


SIMPLE = [0, 1, -1, 2 ** 70, 1.5, -0.0, float("nan"), float("inf"), True, False, None, "",
          "a", "abc", b"", b"a", b"abc"]
OTHER = [IntSub(1), StrSub("a"), Counted(), EqRaises(), [1, 2], (1, "a"), {"k": 1}]

CONDITIONS = [
    "x == 1", "x != 1", "x < 1", "x <= 1.5", "x > -1", "x >= 'a'", "x == b'a'", "x == 1.5",
    "x is None", "x is not None", "x is True", "x in 'abc'", "x in b'abc'",
    "x in (1, 'a', None)", "x not in (1, 'a',)", "x not in 'abc'", "1 == x", "'a' < x",
    "x == y", "x != x", "x", "not x", "not not x", "x == 'a' and y == 1", "x == 1 or y == 1",
    "(x == 1 or x == 'a') and not y == 2", "x == -1 or x == 0x10 or x == 1e3",
    "y in x", "x.attr == 1", "x[0] == 1", "x['k'] == 1", "x[-1] == 'a'",
    "x == None", "x == True", "x < 'b' and x > ''", "x == 2 ** 70",
]


def answers(cond, x, y=1):
    frame = sys._getframe()
    return breakpoints.condition_answers(cond, frame)


def expected(cond, x, y=1):
    try:
        return bool(eval(cond, globals(), {"x": x, "y": y}))
    except Exception:
        return None


@pytest.mark.parametrize("cond", CONDITIONS)
def test_the_fast_path_agrees_with_the_compiled_code(cond):
    for x in SIMPLE + OTHER:
        for y in (1, "a", None):
            want = expected(cond, x, y)
            fast, full = answers(cond, x, y)
            assert full == want, (cond, x, y)
            assert fast in (None, want), (cond, x, y)


# Conditions whose operands are all of exact built-in types: the fast path must answer.
@pytest.mark.parametrize("cond,x,want", [
    ("x == 1", 1, True), ("x == 1", 2, False), ("x != 1", 2, True), ("x < 1", 0.5, True),
    ("x <= 1.5", float("nan"), False), ("x == x", float("nan"), False),
    ("x != x", float("nan"), True), ("x >= 'a'", "b", True), ("x == b'a'", b"a", True),
    ("x is None", None, True), ("x is not None", 0, True), ("x in 'abc'", "bc", True),
    ("x in (1, 'a', None)", None, True), ("x not in (1, 'a',)", 2, True),
    ("x == 'a' and y == 1", "a", True), ("x == 1 or y == 1", 0, True), ("not x", "", True),
    ("x == -1", -1, True), ("x == 2 ** 70", 2 ** 70, None), ("x == 1180591620717411303424", 2 ** 70, True),
    ("x == 0x10", 16, True), ("x == 1e3", 1000, True), ("x == 1_000", 1000, True),
    ("x == True", 1, True), ("x == -0.0", 0, True), ("x < 'b' and x > ''", "a", True),
    ("x[0] == 1", [1, 2], True), ("x[-1] == 'a'", (1, "a"), True), ("x['k'] == 1", {"k": 1}, True),
    ("x.attr == 1", Holder(1), True), ("x.attr == 1", types.SimpleNamespace(attr=2), False),
    ("x == 'été'", "été", True), ("(x == 1 or x == 2) and not (x == 2)", 1, True),
])
def test_simple_operands_take_the_fast_path(cond, x, want):
    fast, full = answers(cond, x)
    assert full == (want if want is not None else expected(cond, x))
    if want is None:
        assert fast is None  # an operator the fast path does not take
    else:
        assert fast is want, (cond, x)


@pytest.mark.parametrize("cond,x", [
    ("x == 1", IntSub(1)), ("x == 'a'", StrSub("a")), ("x in 'abc'", StrSub("a")),
    ("x == 1", Counted()), ("x == 1", EqRaises()), ("x in (1, 2,)", Counted()),
    ("y in x", (Counted(), 1)), ("x.attr == 1", Prop()), ("x[0] == 1", [IntSub(1)]),
    ("x", [1]), ("x == y", 1.5 + 0j), ("x.real == 1", 1), ("x.__class__ is int", 1),
    ("x == len", 1), ("x < 1 < 2", 0), ("x == 1 if y else 2", 1), ("x == (1)", 1),
    ("x == 'a' 'b'", "ab"), ("x == '\\x61'", "a"), ("x == r'a'", "a"), ("x == 1j", 1),
])
def test_other_operands_and_shapes_are_left_to_the_compiled_code(cond, x):
    Counted.calls = Prop.calls = 0
    want = expected(cond, x)
    by_eval = (Counted.calls, Prop.calls)
    Counted.calls = Prop.calls = 0
    fast, full = answers(cond, x)
    assert fast is None, cond
    assert full == want
    # Comparisons and properties of their own ran as often as in one evaluation by eval.
    assert (Counted.calls, Prop.calls) == by_eval


def test_names_are_read_from_locals_then_globals_and_never_from_builtins():
    global only_global
    only_global = 5
    try:
        assert answers("only_global == 5", 0) == (True, True)
        # A local of the same name hides it.
        only_global_local = answers.__code__  # noqa: F841 (a local of this frame)
        frame = sys._getframe()
        assert breakpoints.condition_answers("only_global_local is None", frame) == (False, False)
        # A builtin is left to the compiled code.
        assert breakpoints.condition_answers("len is None", frame) == (None, False)
        assert breakpoints.condition_answers("no_such_name == 1", frame) == (None, None)
    finally:
        del only_global


def test_module_level_frames_read_their_namespace():
    namespace = {"breakpoints": breakpoints, "sys": sys, "x": 3}
    exec("r = breakpoints.condition_answers('x == 3 and not x == 4', sys._getframe())",
         namespace)
    assert namespace["r"] == (True, True)


def test_an_unbound_local_falls_back_to_the_global_as_the_compiled_code_reads_it():
    global x_unbound
    x_unbound = 7

    def f():
        frame = sys._getframe()
        got = breakpoints.condition_answers("x_unbound == 7", frame)
        if False:
            x_unbound = 0  # noqa: F841 (makes it a local of f, unbound here)
        return got

    try:
        assert f() == (True, True)
    finally:
        del x_unbound


def test_deep_nesting_and_long_conditions_are_answered():
    frame = sys._getframe()
    x = 1  # noqa: F841
    deep = "not " * 200 + "x == 1"
    assert breakpoints.condition_answers(deep, frame) == (None, True)
    long_or = " or ".join(["x == 2"] * 5000 + ["x == 1"])
    assert breakpoints.condition_answers(long_or, frame)[1] is True
    assert breakpoints.condition_answers("x == '" + "a" * 100_000 + "'", frame) == (False, False)


def test_argument_errors():
    with pytest.raises(TypeError):
        breakpoints.condition_answers("x", None)
    with pytest.raises(TypeError):
        breakpoints.condition_answers(b"x", sys._getframe())
    with pytest.raises(ValueError):
        breakpoints.condition_answers("x\0", sys._getframe())


def test_the_submodule_is_importable_by_name():
    import importlib
    assert importlib.import_module("tvantrel30pydebugstackless.breakpoints") is breakpoints
    assert tvantrel30pydebugstackless.breakpoints is breakpoints


def test_each_variable_is_read_from_its_own_slot():
    def frame_of(first, second="two", *rest, **named):
        third = 3.0
        shared = "cell"

        def inner():
            return shared

        return sys._getframe()

    frame = frame_of(1, "two", 9, key=1)
    for cond, want in [("first == 1", True), ("second == 'two'", True), ("third == 3.0", True),
                       ("first == 'two'", False), ("second == 1", False),
                       ("shared == 'cell'", True), ("rest is None", False)]:
        fast, full = breakpoints.condition_answers(cond, frame)
        assert full is want, cond
        assert fast in (None, want), cond
    assert breakpoints.condition_answers("third == 3.0", frame)[0] is True
