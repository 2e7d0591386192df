"""Runs one scenario of the core's WaitForInput with real pipes and socket pairs and prints
what it saw as one JSON object. test_input_wait.py runs each scenario in a subprocess with a
time limit, so that a wait that never ends fails its test instead of stalling the run.

Usage: python input_wait_driver.py SCENARIO
"""

import ctypes
import io
import json
import os
import resource
import signal
import socket
import sys
import threading
import time

import tvantrel30pydebugstackless as core
from core_args import init_args

DELAY = 0.3  # how long a helper thread lets the wait block before it acts


def later(action, delay=DELAY):
    """Runs `action` in a thread after `delay` seconds; the thread is returned started."""
    def run():
        time.sleep(delay)
        action()

    thread = threading.Thread(target=run, daemon=True)
    thread.start()
    return thread


def timed_wait(file, socket_list):
    start = time.monotonic()
    result = core.WaitForInput(file, socket_list)
    return result, time.monotonic() - start


def raised(call):
    try:
        call()
    except BaseException as error:  # the type and text are the result
        return [type(error).__name__, str(error)]
    return None


def open_descriptors():
    return sorted(int(name) for name in os.listdir("/proc/self/fd"))


def set_debug_mask(mask):
    ctypes.c_uint.in_dll(ctypes.CDLL(core.__file__), "gDPrintfMask").value = mask


def debug_log(mask):
    log = io.StringIO()
    core.init(*init_args(dprintf_file=log))
    set_debug_mask(mask)
    return log


class FilenoGives:
    """A socket-list item whose fileno() answers what it was given (or raises it)."""

    def __init__(self, value, before=None):
        self.value = value
        self.before = before

    def fileno(self):
        if self.before is not None:
            self.before()
        if isinstance(self.value, BaseException):
            raise self.value
        return self.value


# ---- Which side is readable -----------------------------------------------------------------


def empty_list_waits_on_file():
    r, w = os.pipe()
    written = []
    later(lambda: (written.append(time.monotonic()), os.write(w, b"data")))
    result, waited = timed_wait(r, [])
    return {"result": result, "waited": waited, "written_before_return": bool(written),
            "read": os.read(r, 10).decode()}


def file_preferred_when_both_readable():
    r, w = os.pipe()
    a, b = socket.socketpair()
    os.write(w, b"f")
    b.send(b"s")
    with open(r, "rb", buffering=0, closefd=False) as file_object:
        by_object = core.WaitForInput(file_object, [a])
    return {"by_descriptor": core.WaitForInput(r, [a]), "by_file_object": by_object,
            "socket_first_in_list": core.WaitForInput(r, [a, a])}


def only_socket_readable():
    r, w = os.pipe()
    a, b = socket.socketpair()
    c, d = socket.socketpair()
    b.send(b"s")
    result = core.WaitForInput(r, [c, a])
    return {"result": result, "socket_data": a.recv(10).decode()}


def socket_becomes_readable():
    r, w = os.pipe()
    a, b = socket.socketpair()
    later(lambda: b.send(b"late"))
    result, waited = timed_wait(r, [a])
    return {"result": result, "waited": waited}


def eof_on_file():
    r, w = os.pipe()
    a, b = socket.socketpair()
    os.close(w)
    immediate = core.WaitForInput(r, [a])
    r2, w2 = os.pipe()
    later(lambda: os.close(w2))
    late, waited = timed_wait(r2, [a])
    return {"closed_before": immediate, "closed_during": late, "waited": waited}


def hang_up_on_socket():
    r, w = os.pipe()
    a, b = socket.socketpair()
    b.close()
    return {"result": core.WaitForInput(r, [a])}


# ---- Failures of the wait ---------------------------------------------------------------


def failed_waits_count_the_file_readable():
    # A descriptor of the list that is not open: select would have failed (EBADF) and left
    # its set as it was, so the file counts as readable although nothing was written to it.
    r, w = os.pipe()
    a, b = socket.socketpair()
    # Above every open descriptor, so that no descriptor the call opens takes its number.
    not_open_fd = open_descriptors()[-1] + 10
    b.send(b"s")
    not_open = core.WaitForInput(r, [FilenoGives(not_open_fd), a])
    # A signal interrupts the wait: a failed wait too.
    caught = []
    previous = signal.signal(signal.SIGUSR1, lambda *args: caught.append(1))
    main = threading.get_ident()
    c, d = socket.socketpair()
    later(lambda: signal.pthread_kill(main, signal.SIGUSR1))
    interrupted, waited = timed_wait(r, [c])
    signal.signal(signal.SIGUSR1, previous)
    return {"not_open_in_list": not_open, "interrupted": interrupted, "waited": waited,
            "handler_ran": bool(caught), "file_was_empty": not _readable_now(r)}


def _readable_now(fd):
    import select
    poller = select.poll()
    poller.register(fd, select.POLLIN)
    return bool(poller.poll(0))


def negative_descriptors_are_skipped():
    r, w = os.pipe()
    a, b = socket.socketpair()
    b.send(b"s")
    socket_side = core.WaitForInput(r, [FilenoGives(-1), a, FilenoGives(-5)])
    os.write(w, b"f")
    file_side = core.WaitForInput(r, [FilenoGives(-1)])
    return {"socket_side": socket_side, "file_side": file_side}


def bad_files():
    r, w = os.pipe()
    a, b = socket.socketpair()
    b.send(b"s")  # a wait that happened would answer 0
    closed_file = open(os.devnull)
    closed_file.close()

    class FilenoRaises:
        def fileno(self):
            raise OSError("no descriptor")

    class FilenoText:
        def fileno(self):
            return "3"

    not_open = os.dup(r)
    os.close(not_open)
    cases = {"str": "x", "none": None, "object": object(), "float": 1.5,
             "closed_file": closed_file, "fileno_raises": FilenoRaises(),
             "fileno_text": FilenoText(), "negative_int": -1, "not_open_int": not_open,
             "huge_int": 2 ** 70, "write_only_end": w}
    results = {}
    for name, file in cases.items():
        results[name] = [core.WaitForInput(file, [a]), repr(sys.exc_info()[1])]
    results["usable_after"] = core.WaitForInput(r, [a])
    return results


def write_only_descriptors():
    r, w = os.pipe()
    a, b = socket.socketpair()
    b.send(b"s")
    wfile = os.open(os.devnull, os.O_WRONLY)
    return {"pipe_write_end": core.WaitForInput(w, [a]),
            "write_only_file": core.WaitForInput(wfile, [a]),
            "read_write_file": core.WaitForInput(os.open(os.devnull, os.O_RDWR), [a])}


# ---- Errors of the arguments and the socket list -------------------------------------------


def argument_errors():
    r, w = os.pipe()
    os.write(w, b"f")  # a wait that happened would answer at once

    class Items(list):
        pass

    class NotAnInt:
        pass

    return {
        "missing_fileno": raised(lambda: core.WaitForInput(r, [object()])),
        "int_item": raised(lambda: core.WaitForInput(r, [5])),
        "fileno_raises": raised(lambda: core.WaitForInput(r, [FilenoGives(KeyError("k"))])),
        "fileno_text": raised(lambda: core.WaitForInput(r, [FilenoGives("3")])),
        "fileno_other": raised(lambda: core.WaitForInput(r, [FilenoGives(NotAnInt())])),
        "fileno_huge": raised(lambda: core.WaitForInput(r, [FilenoGives(2 ** 40)])),
        "fileno_float": raised(lambda: core.WaitForInput(r, [FilenoGives(3.0)])),
        "tuple": raised(lambda: core.WaitForInput(r, ())),
        "none": raised(lambda: core.WaitForInput(r, None)),
        "list_subclass": raised(lambda: core.WaitForInput(r, Items())),
        "one_argument": raised(lambda: core.WaitForInput(r)),
        "three_arguments": raised(lambda: core.WaitForInput(r, [], 1)),
        "later_item_missing_fileno": raised(
            lambda: core.WaitForInput(r, [FilenoGives(-1), object()])),
        "usable_after": core.WaitForInput(r, []),
    }


def list_changed_by_fileno():
    r, w = os.pipe()
    a, b = socket.socketpair()
    b.send(b"s")
    shrinking = []
    shrinking.extend([FilenoGives(a.fileno(), before=shrinking.clear), object(), object()])
    growing = []
    growing.append(FilenoGives(a.fileno(), before=lambda: growing.extend([object()] * 100)))
    return {"shrinking": core.WaitForInput(r, shrinking), "shrunk_to": len(shrinking),
            "growing": core.WaitForInput(r, growing), "grown_to": len(growing)}


# ---- Descriptors and threads ---------------------------------------------------------------


def descriptors_above_the_select_limit():
    soft, hard = resource.getrlimit(resource.RLIMIT_NOFILE)
    if soft < 4096:
        resource.setrlimit(resource.RLIMIT_NOFILE, (4096, max(hard, 4096)))
    # Every descriptor below 1100 taken, so that the core's own copies land above 1024 too.
    fillers = []
    while True:
        fd = os.open(os.devnull, os.O_RDONLY)
        fillers.append(fd)
        if fd >= 1100:
            break
    r, w = os.pipe()
    a, b = socket.socketpair()
    os.dup2(r, 1500)
    os.dup2(a.fileno(), 1600)
    high_socket = FilenoGives(1600)
    log = debug_log(4 | 32)
    b.send(b"s")
    socket_side = core.WaitForInput(1500, [high_socket])
    a.recv(10)
    os.write(w, b"f")
    file_side = core.WaitForInput(1500, [high_socket])
    os.read(1500, 10)
    later(lambda: b.send(b"late"))
    late_socket = core.WaitForInput(1500, [high_socket])
    return {"socket_side": socket_side, "file_side": file_side, "late_socket": late_socket,
            "log": log.getvalue()}


def no_stream_or_descriptor_left_behind():
    r, w = os.pipe()
    a, b = socket.socketpair()
    os.write(w, b"payload")
    before = open_descriptors()
    answers = set()
    for _ in range(1000):
        answers.add(core.WaitForInput(r, [a]))
    for _ in range(1000):
        answers.add(core.WaitForInput(w, [a]))
    for _ in range(1000):
        answers.add(core.WaitForInput("x", [a]))
    for _ in range(1000):
        try:
            core.WaitForInput(r, [a, object()])
        except AttributeError:
            pass
    after = open_descriptors()
    os.fstat(r)
    return {"answers": sorted(answers), "before": before, "after": after,
            "read_after": os.read(r, 100).decode(), "write_after": os.write(w, b"more"),
            "read_again": os.read(r, 100).decode()}


def other_threads_run_while_waiting():
    r, w = os.pipe()
    a, b = socket.socketpair()
    c, d = socket.socketpair()
    sockets = [a, c]
    result = []
    waiter = threading.Thread(target=lambda: result.append(core.WaitForInput(r, sockets)))
    waiter.start()
    # This thread runs Python code while the other one waits: the lock is free.
    counted = 0
    deadline = time.monotonic() + DELAY
    while time.monotonic() < deadline:
        counted += 1
    waiting_while_counting = waiter.is_alive() and not result
    # The list may change while the copy of its descriptors is in use (the sockets stay
    # open: a descriptor closed during the wait is another matter).
    sockets.clear()
    sockets.extend([object(), "not a socket"])
    d.send(b"s")
    waiter.join(20)
    return {"counted": counted, "waiting_while_counting": waiting_while_counting,
            "result": result, "still_waiting": waiter.is_alive()}


# ---- Debug messages ------------------------------------------------------------------------


def debug_messages():
    r, w = os.pipe()
    a, b = socket.socketpair()
    log = debug_log(4 | 32)
    b.send(b"s")
    socket_side = core.WaitForInput(r, [a, FilenoGives(-1)])
    socket_log = log.getvalue()
    log.seek(0)
    log.truncate()
    os.write(w, b"f")
    file_side = core.WaitForInput(r, [])
    file_log = log.getvalue()
    log.seek(0)
    log.truncate()
    core.WaitForInput("not a file", [a])
    bad_file_log = log.getvalue()
    log.seek(0)
    log.truncate()
    raised(lambda: core.WaitForInput(r, [object()]))
    bad_list_log = log.getvalue()
    set_debug_mask(4 | 16)  # the default: the wait's own class is off
    log.seek(0)
    log.truncate()
    core.WaitForInput(r, [a])
    default_log = log.getvalue()
    set_debug_mask(32)
    log.seek(0)
    log.truncate()
    core.WaitForInput(r, [a])
    input_only_log = log.getvalue()
    return {"socket_side": socket_side, "file_side": file_side, "socket_fd": a.fileno(),
            "socket_log": socket_log, "file_log": file_log, "bad_file_log": bad_file_log,
            "bad_list_log": bad_list_log, "default_log": default_log,
            "input_only_log": input_only_log}


if __name__ == "__main__":
    print(json.dumps(globals()[sys.argv[1]]()))
