"""Repeats a round of WaitForInput and CopyIntoBuffer calls and prints the interpreter's total
reference count after each round, one number per line. Run by test_refcounts.py on the debug
interpreter.

A round: thousands of waits that answer at once (a readable pipe, a readable socket of a
socket pair, a file object, end of file), waits that fail (bad file objects, a write-only
descriptor), socket lists whose items have no fileno or answer something that is not an int,
a list of the wrong type; and copies that fit, are truncated, or are refused (offset out of
range, read-only target, bad data). The debug channel is on for every message class the wait
prints, so that writing its messages is measured too.

Usage: python refcount_input_wait.py ROUNDS
"""

import array
import ctypes
import gc
import os
import socket
import sys

import tvantrel30pydebugstackless as core
from core_args import init_args

# The interpreter's type attribute cache keeps the last name looked up in each slot: a lookup
# by a C string leaves a fresh name object there until another lookup evicts it. Emptied
# before each reading, so that the totals show only what the core itself still holds.
_clear_interpreter_caches = getattr(sys, "_clear_internal_caches", None) or sys._clear_type_cache

CALLS = 500


class Items(list):
    """A list subclass: not exactly a list, refused by the descriptor copy."""


class Fileno:
    def __init__(self, value):
        self.value = value

    def fileno(self):
        return self.value


def expect(error, call, *args):
    try:
        call(*args)
    except error:
        return
    raise AssertionError(f"{call.__name__}{args!r} did not raise {error.__name__}")


def waits(r, w, ended, a, readable_file):
    answers = {}
    for _ in range(CALLS):
        for key, answer in (("pipe", core.WaitForInput(r, [a])),
                            ("file object", core.WaitForInput(readable_file, [])),
                            ("end of file", core.WaitForInput(ended, [a, Fileno(-1)])),
                            ("bad file", core.WaitForInput("x", [a])),
                            ("write only", core.WaitForInput(w, [a]))):
            answers[key] = answer
        expect(AttributeError, core.WaitForInput, r, [a, object()])
        expect(TypeError, core.WaitForInput, r, [Fileno("3")])
        expect(OverflowError, core.WaitForInput, r, [Fileno(2 ** 40)])
        expect(TypeError, core.WaitForInput, r, (a,))
        expect(SystemError, core.WaitForInput, r, Items())
    assert answers == {"pipe": 1, "file object": 1, "end of file": 1, "bad file": -1,
                       "write only": -1}, answers


def socket_waits(quiet_r, a):
    for _ in range(CALLS):
        assert core.WaitForInput(quiet_r, [a]) == 0


def copies():
    target = bytearray(8)
    ints = array.array("i", [0, 0])
    for _ in range(CALLS):
        assert core.CopyIntoBuffer(target, 2, b"abcdefghij") == 6
        assert core.CopyIntoBuffer(memoryview(target), 0, "h\xe9") == 3
        assert core.CopyIntoBuffer(ints, 4, b"\x01\x02") == 2
        assert core.CopyIntoBuffer(target, 8, b"x") == 0
        expect(ValueError, core.CopyIntoBuffer, target, 9, b"x")
        expect(ValueError, core.CopyIntoBuffer, target, -1, b"x")
        expect(TypeError, core.CopyIntoBuffer, b"read only", 0, b"x")
        expect(TypeError, core.CopyIntoBuffer, target, 0, bytearray(b"x"))
        expect(UnicodeEncodeError, core.CopyIntoBuffer, target, 0, "\udcff")
    target.append(0)  # every buffer was given back


def round_(fixtures):
    waits(*fixtures["waits"])
    socket_waits(*fixtures["socket_waits"])
    copies()


def make_fixtures():
    r, w = os.pipe()
    os.write(w, b"ready")
    ended_r, ended_w = os.pipe()
    os.close(ended_w)
    quiet_r, quiet_w = os.pipe()
    a, b = socket.socketpair()
    b.send(b"ready")
    readable_file = open(r, "rb", buffering=0, closefd=False)
    # The writing ends stay referenced so that nothing is closed during the rounds.
    return {"waits": (r, w, ended_r, a, readable_file), "socket_waits": (quiet_r, a),
            "keep": (quiet_w, b), "close": (readable_file, a, b)}


def main(rounds):
    debug_file = open(os.devnull, "w")
    core.init(*init_args(dprintf_file=debug_file))
    ctypes.c_uint.in_dll(ctypes.CDLL(core.__file__), "gDPrintfMask").value = 4 | 32
    fixtures = make_fixtures()
    round_(fixtures)  # the interpreter and the modules fill their own caches first
    gc.collect()
    # Machine integers, made before measuring: storing int objects in place of the immortal
    # small int 0 (3.12 on) would itself add a counted reference per round.
    totals = array.array("q", [0] * rounds)
    for i in range(rounds):
        round_(fixtures)
        _clear_interpreter_caches()
        gc.collect()
        totals[i] = sys.gettotalrefcount()
    for total in totals:
        print(total)
    for item in fixtures["close"]:
        item.close()


if __name__ == "__main__":
    main(int(sys.argv[1]))
