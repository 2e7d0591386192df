"""The prediction the console shows at an exception stop (the core's
`analysis.predict_catch`, asked by the session), checked against what the interpreter then
really does: for every exception a case raises, the kind of answer is the one expected, and
an exception said to be caught is caught, one said not to be caught escapes."""

import json
import subprocess
import sys
import textwrap

import pytest

CASES = {  # name -> (source, the kind predicted for each exception raised)
    "typed clause": ("""
        try:
            raise KeyError("k")
        except KeyError:
            pass
    """, ['caught']),
    "other type": ("""
        try:
            raise KeyError("k")
        except ValueError:
            pass
    """, ['uncaught']),
    "tuple and attribute": ("""
        import errno, os
        try:
            raise FileNotFoundError(errno.ENOENT, "x")
        except (ValueError, os.error):
            pass
    """, ['caught']),
    "second clause": ("""
        try:
            raise TypeError("t")
        except ValueError:
            pass
        except TypeError as error:
            pass
    """, ['caught']),
    "no clause matches": ("""
        try:
            raise TypeError("t")
        except ValueError:
            pass
        except KeyError:
            pass
    """, ['uncaught']),
    "bare except": ("""
        try:
            raise OSError("o")
        except:
            pass
    """, ['caught']),
    "finally only": ("""
        try:
            raise OSError("o")
        finally:
            done = True
    """, ['uncaught']),
    "finally inside a catching try": ("""
        try:
            try:
                raise OSError("o")
            finally:
                done = True
        except OSError:
            pass
    """, ['caught']),
    "with block": ("""
        import contextlib
        with contextlib.nullcontext():
            raise OSError("o")
    """, ['with']),
    "with inside a catching try": ("""
        import contextlib
        try:
            with contextlib.nullcontext():
                raise OSError("o")
        except OSError:
            pass
    """, ['caught']),
    "raised in a caller's try": ("""
        def inner():
            raise LookupError("l")
        try:
            inner()
        except LookupError:
            pass
    """, ['caught']),
    "caller catches something else": ("""
        def inner():
            raise LookupError("l")
        try:
            inner()
        except ArithmeticError:
            pass
    """, ['uncaught']),
    "raised in an except block": ("""
        try:
            raise KeyError("k")
        except KeyError:
            raise ValueError("v")
    """, ['caught', 'uncaught']),
    "nested handler re-raises to an outer one": ("""
        try:
            try:
                raise KeyError("k")
            except ValueError:
                pass
        except LookupError:
            pass
    """, ['caught']),
    "local class name": ("""
        Special = KeyError
        try:
            raise KeyError("k")
        except Special:
            pass
    """, ['caught']),
    "C code between": ("""
        class Thing:
            @property
            def value(self):
                raise AttributeError("no value")
        found = hasattr(Thing(), "value")
    """, ["c-code"]),
    "C code that lets it through": ("""
        def key(item):
            raise LookupError(item)
        sorted([1, 2], key=key)
    """, ["c-code"]),
    "suppressing with": ("""
        import contextlib
        with contextlib.suppress(ValueError):
            raise ValueError("v")
    """, ["caught"]),
    "with that suppresses another type": ("""
        import contextlib
        with contextlib.suppress(KeyError):
            raise ValueError("v")
    """, ["uncaught"]),
}


# Runs one case in a process of its own, where the case's caller is the outermost frame
# (in the test runner's process, the runner's own handlers would catch everything).
HARNESS = """
import json, sys
import tvantrel30pydebugstackless as core

namespace = {}
exec(compile(sys.stdin.read(), "<case>", "exec"), namespace)
case = namespace["case"]
ignored = {sys._getframe().f_code: 1}  # this frame's handler catches nothing of the case
predictions = {}  # id of the exception -> (exception, the kind predicted)


def tracer(frame, event, arg):
    if event == "exception" and frame.f_code.co_filename == "<case>" \\
            and id(arg[1]) not in predictions:
        kind = core.analysis.predict_catch(frame, arg[1], ignored)[0]
        predictions[id(arg[1])] = (arg[1], kind)
    return tracer


escaped = None
sys.settrace(tracer)
try:
    case()
except BaseException as error:
    escaped = error
finally:
    sys.settrace(None)
print(json.dumps([[kind, exc is not escaped] for exc, kind in predictions.values()]))
"""


def _predictions_and_fates(source):
    """For each exception the case raises, in order: (the kind predicted, really caught),
    the prediction made at the exception's first event, in the frame that raised it."""
    function_source = "def case():\n" + textwrap.indent(textwrap.dedent(source), "    ")
    done = subprocess.run([sys.executable, "-c", HARNESS], input=function_source,
                          capture_output=True, text=True, timeout=60)
    assert done.returncode == 0, done.stderr
    results = json.loads(done.stdout)
    assert results, "no exception event was seen"
    return [tuple(result) for result in results]


@pytest.mark.parametrize("name", sorted(CASES))
def test_prediction_matches_the_interpreter(name):
    source, expected = CASES[name]
    results = _predictions_and_fates(source)
    assert [kind for kind, _caught in results] == expected
    for kind, caught in results:
        if kind == "caught":
            assert caught
        elif kind == "uncaught":
            assert not caught
