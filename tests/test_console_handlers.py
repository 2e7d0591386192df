"""The console's prediction, at the moment an exception is raised, of whether it will be
caught (selvane.handlers), checked against what the interpreter then really does."""

import sys
import textwrap

import pytest

from selvane import handlers

CASES = {
    "typed clause": """
        try:
            raise KeyError("k")
        except KeyError:
            pass
    """,
    "other type": """
        try:
            raise KeyError("k")
        except ValueError:
            pass
    """,
    "tuple and attribute": """
        import errno, os
        try:
            raise FileNotFoundError(errno.ENOENT, "x")
        except (ValueError, os.error):
            pass
    """,
    "second clause": """
        try:
            raise TypeError("t")
        except ValueError:
            pass
        except TypeError as error:
            pass
    """,
    "no clause matches": """
        try:
            raise TypeError("t")
        except ValueError:
            pass
        except KeyError:
            pass
    """,
    "bare except": """
        try:
            raise OSError("o")
        except:
            pass
    """,
    "finally only": """
        try:
            raise OSError("o")
        finally:
            done = True
    """,
    "finally inside a catching try": """
        try:
            try:
                raise OSError("o")
            finally:
                done = True
        except OSError:
            pass
    """,
    "with block": """
        import contextlib
        with contextlib.nullcontext():
            raise OSError("o")
    """,
    "with inside a catching try": """
        import contextlib
        try:
            with contextlib.nullcontext():
                raise OSError("o")
        except OSError:
            pass
    """,
    "raised in a caller's try": """
        def inner():
            raise LookupError("l")
        try:
            inner()
        except LookupError:
            pass
    """,
    "caller catches something else": """
        def inner():
            raise LookupError("l")
        try:
            inner()
        except ArithmeticError:
            pass
    """,
    "raised in an except block": """
        try:
            raise KeyError("k")
        except KeyError:
            raise ValueError("v")
    """,
    "nested handler re-raises to an outer one": """
        try:
            try:
                raise KeyError("k")
            except ValueError:
                pass
        except LookupError:
            pass
    """,
    "local class name": """
        Special = KeyError
        try:
            raise KeyError("k")
        except Special:
            pass
    """,
}


def _predictions_and_fates(source):
    """For each exception the case raises: (predicted caught, really caught), the
    prediction made at the exception's first event, in the frame that raised it."""
    function_source = "def case():\n" + textwrap.indent(textwrap.dedent(source), "    ")
    namespace = {}
    exec(compile(function_source, "<case>", "exec"), namespace)
    case = namespace["case"]
    predictions = {}  # id of the exception -> (exception, predicted caught)

    def tracer(frame, event, arg):
        if event == "exception" and frame.f_code.co_filename == "<case>" \
                and id(arg[1]) not in predictions:
            handler = handlers.find_handler(frame, arg[0], {_predictions_and_fates.__code__})
            predictions[id(arg[1])] = (arg[1], handler is not None)
        return tracer

    escaped = None
    sys.settrace(tracer)
    try:
        case()
    except BaseException as error:
        escaped = error
    finally:
        sys.settrace(None)
    assert predictions, "no exception event was seen"
    return [(predicted, exc is not escaped) for exc, predicted in predictions.values()]


@pytest.mark.parametrize("name", sorted(CASES))
def test_prediction_matches_the_interpreter(name):
    for predicted, caught in _predictions_and_fates(CASES[name]):
        assert predicted == caught
