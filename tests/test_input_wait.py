"""WaitForInput and CopyIntoBuffer.

Every wait runs in a subprocess (input_wait_driver.py) with a time limit, on real pipes and
socket pairs: a wait that never ends fails its test instead of stalling the run. The copies
never wait and run in this process.
"""

import array
import json
import os
import re
import subprocess
import sys

import pytest

import tvantrel30pydebugstackless as core

HERE = os.path.dirname(os.path.abspath(__file__))
DRIVER = os.path.join(HERE, "input_wait_driver.py")
TIMEOUT = 60
DELAY = 0.3  # the driver's helper threads act after this long


def scenario(name):
    try:
        proc = subprocess.run([sys.executable, DRIVER, name], capture_output=True, text=True,
                              timeout=TIMEOUT, cwd=HERE)
    except subprocess.TimeoutExpired as hang:
        pytest.fail(f"{name}: the wait did not end within {TIMEOUT} s\n{hang.stderr}")
    assert proc.returncode == 0, f"{name} failed ({proc.returncode}):\n{proc.stderr[-3000:]}"
    return json.loads(proc.stdout)


# ---- Which side is readable ----------------------------------------------------------------


def test_an_empty_socket_list_waits_on_the_file_alone():
    seen = scenario("empty_list_waits_on_file")
    assert seen["result"] == 1
    assert seen["written_before_return"]
    assert seen["waited"] >= DELAY * 0.8
    assert seen["read"] == "data"  # the wait consumed nothing


def test_the_file_is_preferred_when_both_are_readable():
    assert scenario("file_preferred_when_both_readable") == {
        "by_descriptor": 1, "by_file_object": 1, "socket_first_in_list": 1}


def test_only_a_socket_readable_answers_0():
    assert scenario("only_socket_readable") == {"result": 0, "socket_data": "s"}


def test_a_socket_that_becomes_readable_ends_the_wait():
    seen = scenario("socket_becomes_readable")
    assert seen["result"] == 0
    assert seen["waited"] >= DELAY * 0.8


def test_end_of_file_counts_as_readable():
    seen = scenario("eof_on_file")
    assert seen["closed_before"] == 1
    assert seen["closed_during"] == 1
    assert seen["waited"] >= DELAY * 0.8


def test_a_hung_up_socket_counts_as_readable():
    assert scenario("hang_up_on_socket") == {"result": 0}


def test_negative_descriptors_of_the_list_are_skipped():
    assert scenario("negative_descriptors_are_skipped") == {"socket_side": 0, "file_side": 1}


def test_a_failed_wait_counts_the_file_as_readable():
    # A descriptor of the list that is not open, and a signal during the wait: in both
    # cases the file counts as readable although nothing was written to it.
    seen = scenario("failed_waits_count_the_file_readable")
    assert seen["not_open_in_list"] == 1
    assert seen["interrupted"] == 1
    assert seen["waited"] >= DELAY * 0.8
    assert seen["handler_ran"]  # the program's signal handler still ran
    assert seen["file_was_empty"]


# ---- Bad files and bad lists ---------------------------------------------------------------


def test_a_file_without_a_readable_descriptor_answers_minus_1_and_leaves_no_error():
    seen = scenario("bad_files")
    usable_after = seen.pop("usable_after")
    assert usable_after == 0
    assert set(seen) == {"str", "none", "object", "float", "closed_file", "fileno_raises",
                         "fileno_text", "negative_int", "not_open_int", "huge_int",
                         "write_only_end"}
    for name, (answer, pending) in seen.items():
        assert (name, answer, pending) == (name, -1, "None")


def test_write_only_descriptors_answer_minus_1():
    assert scenario("write_only_descriptors") == {
        "pipe_write_end": -1, "write_only_file": -1, "read_write_file": 1}


def test_socket_list_errors_propagate():
    seen = scenario("argument_errors")
    assert seen.pop("usable_after") == 1
    assert seen["missing_fileno"] == ["AttributeError",
                                      "'object' object has no attribute 'fileno'"]
    assert seen["int_item"][0] == "AttributeError"
    assert seen["later_item_missing_fileno"][0] == "AttributeError"
    assert seen["fileno_raises"] == ["KeyError", "'k'"]
    assert seen["fileno_text"] == ["TypeError",
                                   "fileno() of socket_list item 0 returned str, not an int"]
    assert seen["fileno_other"] == ["TypeError",
                                    "fileno() of socket_list item 0 returned NotAnInt, "
                                    "not an int"]
    assert seen["fileno_float"][0] == "TypeError"
    assert seen["fileno_huge"] == ["OverflowError", "fileno() of socket_list item 0 returned "
                                   "1099511627776, which is not a descriptor"]
    assert seen["tuple"] == ["TypeError", "argument 2 must be list, not tuple"]
    assert seen["none"] == ["TypeError", "argument 2 must be list, not None"]
    # A list subclass passes the argument format but is not a list to the descriptor copy.
    assert seen["list_subclass"] == ["SystemError", "bad argument to internal function"]
    assert seen["one_argument"][0] == "TypeError"
    assert seen["three_arguments"][0] == "TypeError"


def test_a_list_changed_by_fileno_is_read_safely():
    # One item's fileno() empties the list, another's grows it: the copy reads what is
    # there, never past the end, and calls no fileno() of an item added meanwhile.
    assert scenario("list_changed_by_fileno") == {
        "shrinking": 0, "shrunk_to": 0, "growing": 0, "grown_to": 101}


# ---- Descriptors and threads -----------------------------------------------------------------


def test_descriptors_above_the_select_limit():
    seen = scenario("descriptors_above_the_select_limit")
    assert (seen["socket_side"], seen["file_side"], seen["late_socket"]) == (0, 1, 0)
    # The stream's own descriptor and the socket's were both above 1024.
    stream_fds = [int(n) for n in re.findall(r"Adding fd (\d+) \(fp_fileno\)", seen["log"])]
    socket_fds = [int(n) for n in re.findall(r"Adding fd (\d+) to read_set", seen["log"])]
    assert len(stream_fds) == 3 and min(stream_fds) > 1024
    assert socket_fds == [1600] * 3


def test_no_stream_or_descriptor_is_left_behind():
    seen = scenario("no_stream_or_descriptor_left_behind")
    assert seen["answers"] == [-1, 1]
    assert seen["after"] == seen["before"]
    # The caller's descriptors are still open and usable.
    assert seen["read_after"] == "payload"
    assert seen["write_after"] == 4
    assert seen["read_again"] == "more"


def test_other_threads_run_and_the_list_may_change_while_waiting():
    seen = scenario("other_threads_run_while_waiting")
    assert seen["waiting_while_counting"]
    assert seen["counted"] > 1000
    assert seen["result"] == [0]
    assert not seen["still_waiting"]


# ---- Debug messages ------------------------------------------------------------------------

POINTER = r"(0x[0-9a-f]+|\(nil\))"


def entering_lines(length):
    return ("Entering WrapWaitForInput\n"
            "Current file buffer count = 0\n"
            rf"Calling WaitOnStdin\(fp = {POINTER}, socket_list length = {length}\n")


def test_debug_messages_of_the_wait():
    seen = scenario("debug_messages")
    assert (seen["socket_side"], seen["file_side"]) == (0, 1)
    socket_fd = seen["socket_fd"]
    init_end = seen["socket_log"].index("DONE WITH INIT VANTREL\n") + len("DONE WITH INIT VANTREL\n")
    assert re.fullmatch(entering_lines(2) +
                        r"Starting WaitOnStdin \(posix version\)\n"
                        r"Adding fd \d+ \(fp_fileno\) to read_set\n"
                        f"Adding fd {socket_fd} to read_set\n"  # the -1 item is skipped
                        r"Starting select\n"
                        r"Debug connection is readable\n",
                        seen["socket_log"][init_end:]), seen["socket_log"]
    assert re.fullmatch(entering_lines(0) +
                        r"Starting WaitOnStdin \(posix version\)\n"
                        r"Adding fd \d+ \(fp_fileno\) to read_set\n"
                        r"Starting select\n"
                        r"File pointer \(stdin\) is readable\n",
                        seen["file_log"]), seen["file_log"]
    assert seen["bad_file_log"] == "Entering WrapWaitForInput\n"
    assert re.fullmatch(entering_lines(1), seen["bad_list_log"]), seen["bad_list_log"]


def test_the_default_mask_shows_only_the_method_s_own_lines():
    seen = scenario("debug_messages")
    assert re.fullmatch(entering_lines(1), seen["default_log"]), seen["default_log"]
    assert re.fullmatch(r"Starting WaitOnStdin \(posix version\)\n"
                        r"Adding fd \d+ \(fp_fileno\) to read_set\n"
                        r"Adding fd \d+ to read_set\n"
                        r"Starting select\n"
                        r"File pointer \(stdin\) is readable\n",
                        seen["input_only_log"]), seen["input_only_log"]


# ---- CopyIntoBuffer --------------------------------------------------------------------------


def assert_buffer_released(target):
    """A bytearray whose buffer is still exported cannot change size."""
    target.extend(b"!")
    del target[-1]


def test_data_longer_than_the_space_is_truncated():
    target = bytearray(b"........")
    assert core.CopyIntoBuffer(target, 5, b"abcdef") == 3
    assert target == b".....abc"
    assert_buffer_released(target)


def test_data_that_fits_exactly_and_shorter_data():
    target = bytearray(b"......")
    assert core.CopyIntoBuffer(target, 2, b"wxyz") == 4
    assert target == b"..wxyz"
    assert core.CopyIntoBuffer(target, 1, b"AB") == 2
    assert target == b".ABxyz"
    assert core.CopyIntoBuffer(target, 0, b"") == 0
    assert target == b".ABxyz"


def test_an_offset_at_the_end_copies_nothing():
    target = bytearray(b"abc")
    assert core.CopyIntoBuffer(target, 3, b"xyz") == 0
    assert target == b"abc"
    assert core.CopyIntoBuffer(bytearray(), 0, b"xyz") == 0


@pytest.mark.parametrize("offset", [-1, -(2 ** 31), 4, 2 ** 31 - 1])
def test_an_offset_outside_the_buffer_is_refused(offset):
    target = bytearray(b"abc")
    with pytest.raises(ValueError) as info:
        core.CopyIntoBuffer(target, offset, b"xyz")
    assert str(info.value) == f"offset {offset} is outside the buffer of 3 bytes"
    assert target == b"abc"
    assert_buffer_released(target)


def test_an_offset_beyond_a_c_int_is_the_interpreter_s_error():
    target = bytearray(b"abc")
    with pytest.raises(OverflowError):
        core.CopyIntoBuffer(target, 2 ** 31, b"x")
    with pytest.raises(TypeError):
        core.CopyIntoBuffer(target, "1", b"x")
    assert target == b"abc"
    assert_buffer_released(target)


def test_writable_targets_of_every_kind():
    backing = bytearray(b"------")
    assert core.CopyIntoBuffer(memoryview(backing)[1:5], 1, b"ABCDEF") == 3
    assert backing == b"--ABC-"
    ints = array.array("i", [0, 0])
    assert core.CopyIntoBuffer(ints, 4, b"\x01\x00\x00\x00\x02") == 4
    assert ints.tolist() == [0, 1]
    chars = array.array("b", [0, 0, 0])
    assert core.CopyIntoBuffer(chars, 1, b"\x05\x06\x07") == 2
    assert chars.tolist() == [0, 5, 6]
    ints.append(3)  # its buffer was given back too
    assert_buffer_released(backing)


@pytest.mark.parametrize("target", [b"abc", memoryview(b"abc"), "abc",
                                    memoryview(bytearray(b"abcdef"))[::2], None, 5])
def test_targets_that_are_not_contiguous_writable_buffers_are_refused(target):
    with pytest.raises(TypeError) as info:
        core.CopyIntoBuffer(target, 0, b"x")
    assert "argument 1 must be read-write bytes-like object" in str(info.value)


def test_a_non_contiguous_view_is_left_untouched():
    backing = bytearray(b"abcdef")
    with pytest.raises(TypeError):
        core.CopyIntoBuffer(memoryview(backing)[::2], 0, b"XYZ")
    assert backing == b"abcdef"
    assert_buffer_released(backing)


def test_data_may_be_str_as_utf8_or_read_only_bytes():
    target = bytearray(8)
    assert core.CopyIntoBuffer(target, 0, "h\xe9\u20ac") == 6
    assert target[:6] == "h\xe9\u20ac".encode()
    assert core.CopyIntoBuffer(target, 6, b"\x00\xff\x01") == 2
    assert target[6:] == b"\x00\xff"
    assert core.CopyIntoBuffer(target, 0, "a\x00b") == 3
    assert target[:3] == b"a\x00b"


@pytest.mark.parametrize("data, error", [
    (bytearray(b"xy"), TypeError), (memoryview(b"xy"), TypeError),
    (array.array("b", [1]), TypeError), (None, TypeError), (5, TypeError),
    ("\udcff", UnicodeEncodeError),
])
def test_data_that_is_not_str_or_read_only_bytes_is_refused(data, error):
    target = bytearray(b"abc")
    with pytest.raises(error):
        core.CopyIntoBuffer(target, 0, data)
    assert target == b"abc"
    assert_buffer_released(target)


def test_copy_argument_count():
    target = bytearray(3)
    for args in [(), (target,), (target, 0), (target, 0, b"x", 1)]:
        with pytest.raises(TypeError):
            core.CopyIntoBuffer(*args)
    assert_buffer_released(target)


# ---- The methods' documentation --------------------------------------------------------------


def test_docstrings():
    assert core.WaitForInput.__doc__ == (
        "Wait until input is available on either the given file object or the socket file "
        "descriptor.  Returns -1 if it was unable to wait for any reason (e.g. if arg 1 is not "
        "a PyFileObject or an internal error occurs), 0 if input on the debug connection is "
        "available, or the number of bytes that can safely be read  for the file object.")
    assert core.CopyIntoBuffer.__doc__ == (
        "Put data into a writable buffer at given offset,  If data is longer than the "
        "remaining buffer space, it is truncated.  Returns # of bytes copied.")


def test_the_two_methods_sit_between_get_changed_bps_lists_and_pyframe_locals_to_fast():
    names = list(vars(core))
    at = names.index("get_changed_bps_lists")
    assert names[at + 1:at + 4] == ["WaitForInput", "CopyIntoBuffer", "PyFrame_LocalsToFast"]
