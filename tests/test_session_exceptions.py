"""The session's reading of an exception's chain and of the library paths, on exceptions and
paths made here (no tracing involved)."""

import os

import pytest

from selvane.session import SessionError, exception_chain, library_paths


def _raised(make):
    try:
        make()
    except BaseException as error:
        return error
    raise AssertionError("nothing was raised")


def test_cause_and_context_in_the_order_the_interpreter_prints_them():
    def make():
        try:
            try:
                {}["k"]
            except KeyError as error:
                raise ValueError("v") from error
        except ValueError:
            raise RuntimeError("r")

    links = exception_chain(_raised(make))
    assert [(type(link.exc).__name__, link.relation) for link in links] == [
        ("RuntimeError", None), ("ValueError", "context"), ("KeyError", "cause")]
    frame, line = links[2].raise_site
    assert frame.f_code.co_name == "make"
    assert line == make.__code__.co_firstlineno + 3


def test_a_suppressed_context_ends_the_chain():
    def make():
        try:
            raise KeyError("k")
        except KeyError:
            raise ValueError("v") from None

    links = exception_chain(_raised(make))
    assert [type(link.exc) for link in links] == [ValueError]


def test_a_cycle_ends_and_a_long_chain_is_cut():
    first, second = ValueError("1"), KeyError("2")
    first.__context__, second.__context__ = second, first
    assert [link.exc for link in exception_chain(first)] == [first, second]
    exc = ValueError(0)
    for i in range(1, 500):
        newer = ValueError(i)
        newer.__cause__ = exc
        exc = newer
    links = exception_chain(exc)
    assert len(links) == 100 and links[-1].exc.args == (400,)


def test_not_an_exception_has_no_chain():
    assert exception_chain(None) == []
    assert exception_chain("text") == []


def test_an_exception_never_raised_has_no_raise_site():
    cause = OSError("made, not raised")
    error = ValueError("v")
    error.__cause__ = cause
    links = exception_chain(error)
    assert links[1].exc is cause and links[1].raise_site == (None, 0)


def test_library_paths(tmp_path):
    paths = library_paths([str(tmp_path)])
    assert os.path.dirname(os.__file__) in paths
    assert str(tmp_path) in paths
    assert any(path.endswith("site-packages") for path in paths)
    assert len(paths) == len(set(paths))
    with pytest.raises(SessionError, match="no file or folder 'nowhere-at-all'"):
        library_paths(["nowhere-at-all"])
