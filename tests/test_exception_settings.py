"""The settings of the exception decision, as methods: the exception mode, the locations not
to stop at again (any spelling of a file finds a filter, only the same text removes it, and
the location number is coarse on purpose), the stop lists, the handlers to disregard and the
catch-info list. These run in the test process; what the settings do to a traced program is
tested with the exception events."""

import os

import pytest

import tvantrel30pydebugstackless as core
from core_args import init_args


@pytest.fixture(autouse=True)
def initialised_core():
    core.init(*init_args())
    yield
    core.clear_exception_ignores()
    core.reset()


def test_exception_mode_is_stored_unchecked():
    for mode in (0, 1, 2, 4, 5, 7, -3):
        core.set_exception_mode(mode)
        assert core.get_exception_mode() == mode
    with pytest.raises(TypeError):
        core.set_exception_mode("1")
    assert core.get_exception_mode() == -3


def test_same_file_under_two_spellings_is_one_filter(tmp_path, monkeypatch):
    path = tmp_path / "m.py"
    path.write_text("x = 1\n")
    monkeypatch.chdir(tmp_path)
    core.ignore_exception_loc(str(path), 10, 1)
    assert core.exception_loc_ignored("m.py", 10) == 1
    assert core.exception_loc_ignored(str(tmp_path / "." / "m.py"), 10) == 1
    assert core.exception_loc_ignored(str(path), 11) == 0
    # Adding the relative spelling finds the first filter instead of adding a second one:
    # removing by the first text removes the only filter.
    core.ignore_exception_loc("m.py", 10, 1)
    core.ignore_exception_loc(str(path), 10, 0)
    assert core.exception_loc_ignored(str(path), 10) == 0


def test_removal_needs_the_text_that_was_added(tmp_path, monkeypatch):
    path = tmp_path / "m.py"
    path.write_text("x = 1\n")
    monkeypatch.chdir(tmp_path)
    core.ignore_exception_loc(str(path), 10, 1)
    core.ignore_exception_loc("m.py", 10, 0)  # another spelling: removes nothing
    assert core.exception_loc_ignored(str(path), 10) == 1
    core.ignore_exception_loc(str(path), 10, 0)
    assert core.exception_loc_ignored(str(path), 10) == 0
    core.ignore_exception_loc(str(path), 10, 0)  # nothing left: not an error


def test_two_files_on_one_line_number_share_an_entry(tmp_path):
    a, b = tmp_path / "a.py", tmp_path / "b.py"
    a.write_text("a = 1\n")
    b.write_text("bb = 2\n")
    core.ignore_exception_loc(str(a), 10, 1)
    core.ignore_exception_loc(str(b), 10, 1)
    core.ignore_exception_loc(str(a), 10, 0)
    assert core.exception_loc_ignored(str(a), 10) == 0
    assert core.exception_loc_ignored(str(b), 10) == 1


def test_a_tuple_location_counts_as_the_sum_of_its_first_two_items(tmp_path):
    path = str(tmp_path / "m.py")
    core.ignore_exception_loc(path, (3, 7), 1)
    assert core.exception_loc_ignored(path, 10) == 1
    assert core.exception_loc_ignored(path, (5, 5, "extra")) == 1
    assert core.exception_loc_ignored(path, (4, 7)) == 0


def test_clear_exception_ignores_empties_the_filters(tmp_path):
    path = str(tmp_path / "m.py")
    for line in range(50):
        core.ignore_exception_loc(path, line, 1)
    core.clear_exception_ignores()
    assert not any(core.exception_loc_ignored(path, line) for line in range(50))
    core.ignore_exception_loc(path, 3, 1)  # the table works again
    assert core.exception_loc_ignored(path, 3) == 1


def test_the_parser_filter_is_not_a_user_filter():
    assert core.exception_loc_ignored("/usr/lib/python3/sre_parse.py", 134) == 0


@pytest.mark.parametrize("bad", [None, "12", 1.5, (1,), ("a", "b"), [3, 4], object()])
def test_a_location_that_is_not_an_int_or_a_pair_of_ints_is_refused(bad, tmp_path):
    path = str(tmp_path / "m.py")
    core.ignore_exception_loc(path, 3, 1)
    with pytest.raises(TypeError):
        core.ignore_exception_loc(path, bad, 1)
    with pytest.raises(TypeError):
        core.exception_loc_ignored(path, bad)
    with pytest.raises(TypeError):
        core.ignore_exception_loc(path, bad, 0)
    assert core.exception_loc_ignored(path, 3) == 1  # nothing lost


def test_filter_arguments_are_parsed():
    with pytest.raises(TypeError, match="tracer_ignore_exception_loc"):
        core.ignore_exception_loc(5, 3, 1)
    with pytest.raises(TypeError, match="tracer_exception_loc_ignored"):
        core.exception_loc_ignored("x")


def test_a_very_long_file_name_is_stored_and_found():
    name = "/" + "d" * 40000 + "/m.py"
    core.ignore_exception_loc(name, 3, 1)
    assert core.exception_loc_ignored(name, 3) == 1
    core.ignore_exception_loc(name, 3, 0)
    assert core.exception_loc_ignored(name, 3) == 0


def test_empty_stop_list_leaves_none_stored():
    core.set_always_stop_excepts((KeyError,))
    core.set_always_stop_excepts(())
    first, second = core.get_always_stop_excepts(), core.get_always_stop_excepts()
    assert first == () and second == ()


def test_stop_list_given_as_a_list_keeps_the_old_tuple():
    core.set_never_stop_excepts((KeyError,))
    with pytest.raises(TypeError):
        core.set_never_stop_excepts([ValueError])
    assert core.get_never_stop_excepts() == (KeyError,)


def test_ignored_handlers_take_any_object():
    for value in ({}, {"x": 1}, None, 5):
        assert core.set_ignored_exception_handlers(value) is None
    with pytest.raises(TypeError, match="set_ignored_exception_handlers"):
        core.set_ignored_exception_handlers()


def test_exiting_on_exception_is_false_without_a_fatal_exception():
    assert core.exiting_on_exception() == 0
    core.set_autoquit(0)
    assert core.exiting_on_exception() == 0


class Info:
    def __init__(self, co_name, mod_name="*", containing_class="*", prints=True, parent=False):
        self.co_name = co_name
        self.mod_name = mod_name
        self.containing_class = containing_class
        self.prints = prints
        self.parent = parent


def test_catch_info_list_must_be_a_list():
    core.set_exc_catch_info_list([Info("f")])
    with pytest.raises(TypeError, match="set_exc_catch_info_list"):
        core.set_exc_catch_info_list((Info("f"),))
    assert core.set_exc_catch_info_list([]) is None


def test_catch_info_item_without_a_function_name_fails_the_call():
    class Nameless:
        pass

    with pytest.raises(AttributeError):
        core.set_exc_catch_info_list([Info("f"), Nameless(), Info("g")])


def test_catch_info_attribute_that_raises_fails_the_call():
    class Raising:
        @property
        def co_name(self):
            raise RuntimeError("no name")

    with pytest.raises(RuntimeError, match="no name"):
        core.set_exc_catch_info_list([Raising()])
