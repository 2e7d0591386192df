"""The debugging session: what the core reports and what the person debugging asks of it,
without any terminal code.

A `Session` initialises the core, answers its callbacks and keeps the state that a front end
shows: the stop being answered (frame, thread, exception, return value), the frame selected
with up/down/thread, the breakpoints with their hit and ignore counts (kept current from the
core's changed-breakpoint lists), the exception settings and the threads. A front end
implements `Frontend` (the console does; an editor protocol could) and calls the session's
methods; it never calls the core itself.

Sub-languages (template languages and the like, implemented in Python) are shown through
their hooks, registered with `register_sub_language_hook`: a key frame (one step of the
sub-language program) is shown at the file and line the hook translates it to, evaluates
expressions with the hook, and takes breakpoints set in the sub-language's files; frames of
the implementation are hidden from the stack and never shown as stops.

Threading: the core calls the callbacks in the stopped thread while holding its mutex; the
other traced threads wait at that mutex. The front end's `stopped()` runs there, and the
resume command it chose is given to the core (which acts on the calling thread's record)
just before the callback returns. Nothing here takes a lock that a waiting thread may hold:
thread names are read from the threading module's table without its lock.
"""

import builtins
import dis
import fnmatch
import functools
import importlib
import linecache
import os
import signal
import sys
import threading
from dataclasses import dataclass, field

import tvantrel30pydebugstackless as core

from . import _ORIGINAL_IMPORT, _PROGRAM_HOOKS, HOOK_METHODS, check_hook
from .catchinfo import DEFAULT_PRINTING_HANDLERS

EXCEPTION_MODES = {"never": 0, "always": 1, "unhandled": 2, "user-unhandled": 3,
                   "printed": 4}
# Exceptions that end a program normally or drive iteration: never stops, unless the mode is
# "always" or the person lists them with `catch always`.
DEFAULT_NEVER_STOP = (SystemExit, StopIteration, StopAsyncIteration, GeneratorExit)
_HERE = os.path.dirname(os.path.abspath(__file__))
_IDLE_PERIOD = 0.2
# Frame categories of the core: a sub-language's key frame, a frame of its implementation.
KEY_FRAME, IMPLEMENTATION_FRAME = 1, 0


class SessionError(Exception):
    """A request of the person debugging that cannot be done; its text says why."""


@dataclass
class Breakpoint:
    number: int
    file: str  # absolute path
    line: int
    temporary: bool = False
    enabled: bool = True
    condition: str = None
    ignore_count: int = 0
    hits: int = 0


@dataclass
class Stop:
    """One stop of one thread. `kind` is "line", "return" or "exception"."""
    kind: str
    frame: object
    thread: int  # thread identity
    value: object = None  # the return value of a return stop
    exc: tuple = None  # (type, value, traceback) of an exception stop
    handler: object = None  # the frame predicted to catch the exception, or None
    catch: object = None  # the core's prediction for the exception (a Catch), or None
    exiting: bool = False  # the exception leaves the program's outermost frame
    reason: str = None  # "breakpoint N", "interrupted", or None (stepping, start)
    deleted: list = field(default_factory=list)  # temporary breakpoints that fired
    inner: object = None  # the frame where the exception was raised
    raise_line: int = 0  # the line of `inner` that raised it
    finished: list = field(default_factory=list)  # frames below `frame` the exception left
    chain: list = field(default_factory=list)  # ChainLink: the exception, then its causes


@dataclass
class Catch:
    """What the core predicts for an exception at a stop. `kind` is "caught" (an except
    clause of `frame` catches it, at `file`:`line`), "c-code" (C code called by `frame` at
    `file`:`line` may end it), "with" (the `with` at `file`:`line` may suppress it) or
    "uncaught"."""
    kind: str
    frame: object = None
    file: str = None
    line: int = 0


@dataclass
class ChainLink:
    """One exception of a chain. `relation` says how it is linked to the exception before it
    in the chain: None for the first (the exception of the stop), "cause" (`raise ... from`)
    or "context" (raised while it was being handled)."""
    exc: BaseException
    relation: str = None
    # Its traceback as the stop's event gave it: the exception being raised may not carry
    # it yet (3.11 attaches it later). None: the exception's own.
    tb: object = None

    @property
    def traceback(self):
        return self.tb if self.tb is not None else getattr(self.exc, "__traceback__", None)

    @property
    def raise_site(self):
        """(frame, line) where it was raised, from its traceback, or (None, 0)."""
        tb = self.traceback
        last = None
        while tb is not None:
            last = tb
            tb = tb.tb_next
        return (last.tb_frame, last.tb_lineno) if last is not None else (None, 0)


@dataclass
class Place:
    """Where a frame stands, as the person debugging sees it: a Python file, line and
    function, or a sub-language's file and line (`function` None) for a key frame."""
    file: str  # absolute path, or a name such as "<string>"
    line: int
    function: str = None

    @property
    def sub_language(self):
        return self.function is None


@dataclass
class ThreadInfo:
    number: int
    ident: int
    name: str
    frame: object  # where it stands in the debugger, or None while it runs
    stopped: bool  # the thread whose stop is being answered


class Frontend:
    """What a front end gives the session."""

    def stopped(self, session, stop):
        """Shows the stop and lets the person work until one resume method of the session
        was called (or none: then the program continues)."""
        raise NotImplementedError

    def message(self, text):
        """A line of news from the session outside any stop."""
        raise NotImplementedError


# CO_GENERATOR, CO_COROUTINE and CO_ASYNC_GENERATOR (inspect has them by name, but the
# debugger does not load modules the program may not use).
_SUSPENDING_CODE = 0x20 | 0x100 | 0x200


def _suspends(frame):
    """Whether a return stop in `frame` is a generator or coroutine suspending (a yield or
    an await), rather than its code ending. The instruction the frame stands at tells."""
    if not frame.f_code.co_flags & _SUSPENDING_CODE:
        return False
    # The frame stands at its YIELD_VALUE (up to 3.12), or at the RESUME right after it
    # (3.13 and later).
    code = frame.f_code.co_code
    return any(0 <= offset < len(code) and dis.opname[code[offset]] == "YIELD_VALUE"
               for offset in (frame.f_lasti, frame.f_lasti - 2))


def _own_files():
    """Full names of the debugger's own modules, as the core reports frame files."""
    names = set()
    for entry in os.listdir(_HERE):
        if entry.endswith(".py"):
            path = os.path.join(_HERE, entry)
            names.add(path)
            names.add(os.path.realpath(path))
    return names


class Session:
    def __init__(self, frontend, exceptions="unhandled", autoquit=True,
                 debug_all_threads=True, skip_threads=(), catch_info=None, on_quit=None,
                 library=()):
        self.frontend = frontend
        self.on_quit = on_quit or _exit_now
        self.own_files = _own_files()
        self.breakpoints = {}  # number -> Breakpoint
        self._core_ids = {}  # core id -> number
        self._next_number = 1
        self.stop = None  # the stop being answered
        self.frame = None  # the selected frame
        self.thread = None  # the identity of the thread whose frames are shown
        self._thread_numbers = {}
        self._resume = None
        self._last_resume = {}  # thread identity -> last resume command
        self._stop_requested = set()  # threads the core was told to stop (interrupt)
        self._interrupt_pending = False
        self._reported_exc = None  # id of the exception last shown after a continue
        self._seeking_first_stop = True
        self._first_stop = None
        self._starting_thread = threading.get_ident()
        self._program_started = False
        self.ignored_codes = set()
        self.skip_threads = tuple(skip_threads)
        self.catch_info = list(DEFAULT_PRINTING_HANDLERS if catch_info is None
                               else catch_info)
        self.active = False
        self._saved_sigint = None
        self._at_prompt = False
        self._new_imports = []
        self.sub_language_hooks = []
        self._clear_exception_view()
        self.library_paths = library_paths(library)
        self._init_core(exceptions, autoquit, debug_all_threads)
        global _current
        _current = self
        for hook in _PROGRAM_HOOKS:  # registered by the program before this session began
            try:
                self.register_sub_language_hook(hook)
            except SessionError as error:
                frontend.message(f"sub-language hook not registered: {error}")

    # ---- the core --------------------------------------------------------------------------

    def _init_core(self, exceptions, autoquit, debug_all_threads):
        if exceptions not in EXCEPTION_MODES:
            raise SessionError(f"unknown exception mode {exceptions!r}")
        internal = {name: 1 for name in self.own_files}
        core.init(_IDLE_PERIOD, EXCEPTION_MODES[exceptions], self._install_thread_hooks,
                  self._idle, self._line_cb, self._return_cb, self._exception_cb,
                  self._quit_cb, None, _ORIGINAL_IMPORT, None, internal)
        core.set_autoquit(1 if autoquit else 0)
        core.set_debug_all_threads(1 if debug_all_threads else 0)
        if self.skip_threads:
            core.set_debug_thread_cb(self._debug_thread)
        core.set_never_stop_excepts(DEFAULT_NEVER_STOP)
        core.set_exc_catch_info_list(self.catch_info)
        self._publish_library()
        # The threads' start-up code catches whatever escapes a thread's run() and prints
        # it: for the person debugging that is an unhandled exception.
        for function in (threading.Thread._bootstrap, threading.Thread._bootstrap_inner):
            self.ignored_codes.add(function.__code__)
        self._publish_ignored()

    def _publish_library(self):
        # The core compares file names with prefixes: a folder ends with its separator, so
        # that "lib" does not take in "library.py" beside it. The debugger's own code is
        # library code too (its runner must never count as the program's own).
        prefixes = [path if os.path.isfile(path) else path.rstrip(os.sep) + os.sep
                    for path in self.library_paths + [_HERE]]
        core.analysis.set_user_code(prefixes)

    def ignore_handlers_of(self, *codes):
        """The handlers of these code objects (the debugger's own frames that run the
        program) do not count as catching an exception."""
        self.ignored_codes.update(codes)
        self._publish_ignored()

    def _publish_ignored(self):
        core.set_ignored_exception_handlers({code: 1 for code in self.ignored_codes})

    def start(self, stop_at_first_line=True, first_stop=None):
        """Starts tracing every thread; the program stops at its first line unless told
        not to (it then runs to a breakpoint). `first_stop(frame)` tells the first stop's
        frame: the stops before it (in the debugger's own code and in what it calls while
        it starts) are passed through."""
        self._seeking_first_stop = stop_at_first_line
        self._first_stop = first_stop
        self._starting_thread = threading.get_ident()
        self.active = True
        if stop_at_first_line:
            core.step_into()
        else:
            core.continue_run()
        self._install_sigint()
        core.start_trace()

    def stop_soon(self, first_stop):
        """Stops the calling thread at the first frame for which `first_stop(frame)` is
        true (set_trace() while the session runs)."""
        self._seeking_first_stop = True
        self._first_stop = first_stop
        self._starting_thread = threading.get_ident()
        core.step_into()

    def program_started(self):
        self._program_started = True

    def finish(self):
        """Stops tracing; the program runs on untraced (or has ended)."""
        if not self.active:
            return
        self.active = False
        core.stop_trace()
        self._restore_sigint()

    def _install_thread_hooks(self, flag):
        # What threading.settrace() does, without running traced library code while the
        # core starts or stops.
        threading._trace_hook = core.bootstrap_new_thread if flag else None

    def _debug_thread(self, ident):
        thread = threading._active.get(ident)
        name = thread.name if thread is not None else ""
        return 0 if any(fnmatch.fnmatchcase(name, p) for p in self.skip_threads) else 1

    def _quit_cb(self):
        pass  # the program's end is reported by the runner, which knows the exit status

    # ---- Ctrl-C while the program runs ---------------------------------------------------

    def _install_sigint(self):
        if threading.current_thread() is not threading.main_thread():
            return
        try:
            self._saved_sigint = signal.signal(signal.SIGINT, self._sigint)
        except ValueError:
            self._saved_sigint = None

    def _restore_sigint(self):
        if self._saved_sigint is not None and signal.getsignal(signal.SIGINT) == self._sigint:
            signal.signal(signal.SIGINT, self._saved_sigint)
        self._saved_sigint = None

    def _sigint(self, signum, frame):
        if self._at_prompt:
            raise KeyboardInterrupt
        # core.stop() acts on the calling thread, here the main thread: it stops at its next
        # event. Threads that run on are told by the idle callback, in their own thread.
        self._interrupt_pending = True
        self._stop_requested.add(threading.get_ident())
        core.stop()

    def _idle(self):
        if self._interrupt_pending:
            ident = threading.get_ident()
            if ident not in self._stop_requested:
                self._stop_requested.add(ident)
                core.stop()

    # ---- callbacks -------------------------------------------------------------------------

    def _line_cb(self, frame, changed):
        self._on_stop(Stop("line", frame, threading.get_ident()), changed)

    def _return_cb(self, frame, value, changed):
        self._on_stop(Stop("return", frame, threading.get_ident(), value=value), changed)

    def _exception_cb(self, frame, exc, changed):
        stop = Stop("exception", frame, threading.get_ident(), exc=tuple(exc))
        self._on_stop(stop, changed)

    def _on_stop(self, stop, changed):
        hit = self._apply_changed(changed, stop)
        ident = stop.thread
        seeking = self._seeking_first_stop and ident == self._starting_thread
        if seeking and self._first_stop is not None and not self._first_stop(stop.frame):
            core.step_into()  # still in the debugger's start-up: on to the program
            return
        if self._is_internal(stop.frame):
            # The debugger's own frames: step through them to the program while starting,
            # run freely once the program is under way (it has ended, or it is a thread).
            if seeking or ident in self._stop_requested:
                core.step_into()  # on to the program's next line
            else:
                core.continue_run()
            return
        if self.sub_language_hooks:
            category = self.frame_category(stop.frame, ident)
            if category == IMPLEMENTATION_FRAME:
                # A sub-language's implementation is never shown: the stepping in force
                # goes on as it was (the core stops there only to report an exception of a
                # key frame again as it passes through).
                return
            if category == KEY_FRAME and stop.kind == "exception" \
                    and self._last_resume.get(ident) in (None, "continue_run") \
                    and not self._sub_language_exception_stops(stop):
                return
        interrupted = ident in self._stop_requested
        self._stop_requested.discard(ident)
        last = self._last_resume.get(ident)
        if stop.kind == "exception":
            if last == "continue_run" and self._propagating(stop):
                core.continue_run()  # the exception shown already, on its way out
                return
            # Ids only: holding the objects would change when the program's objects die.
            self._reported_exc = (id(stop.exc[1]), id(stop.frame))
            self._predict(stop)
        elif interrupted and last == "continue_run" and hit is None:
            if not self._interrupt_pending:
                core.continue_run()  # an interrupt that another thread answered already
                return
        if interrupted and self._interrupt_pending and hit is None:
            stop.reason = "interrupted"
        elif hit is not None:
            stop.reason = f"breakpoint {hit.number}"
        self._interrupt_pending = False
        self._seeking_first_stop = False
        self._first_stop = None
        self._answer(stop)

    def _propagating(self, stop):
        """Whether this exception event is the last one shown, reported again by a caller
        as it unwinds (and not a new exception, which may reuse the old one's memory)."""
        if self._reported_exc is None:
            return False
        value_id, frame_id = self._reported_exc
        if id(stop.exc[1]) != value_id or id(stop.frame) == frame_id:
            return False
        tb = stop.exc[2]
        while tb is not None:
            if id(tb.tb_frame) == frame_id:
                return True
            tb = tb.tb_next
        return False

    def _answer(self, stop):
        self.stop = stop
        self.frame = stop.frame
        self.thread = stop.thread
        self._resume = None
        if stop.kind == "exception":
            self._selected_exception = len(stop.chain) - 1
            self._show_exception(stop.chain[0])
            self.frame = stop.frame  # the stop shows where the program stands
        try:
            self.frontend.stopped(self, stop)
        finally:
            self.stop = None
            self.frame = None
            self._clear_exception_view()
        resume = self._resume or ("continue_run",)
        self._last_resume[stop.thread] = resume[0]
        if resume[0] == "quit":
            self.finish()
            self.on_quit()
            return
        getattr(core, resume[0])(*resume[1:])

    def _clear_exception_view(self):
        # Frames and exceptions of the program are not kept past the stop.
        self._view = None
        self._frame_lines = []
        self._finished = []
        self._finished_lines = {}
        self._selected_exception = None

    def _is_internal(self, frame):
        return frame.f_code.co_filename in self.own_files

    def _sub_language_exception_stops(self, stop):
        """Whether an exception raised by a key frame stops the program that runs freely.
        The core asks the hook about such an exception in the same terms whether the
        program steps or runs freely, so a hook that reports its exceptions has every one
        of them stop; this applies the exception settings to it as the core applies them to
        Python frames."""
        exc_type = stop.exc[0]
        mode = core.get_exception_mode()
        if mode == EXCEPTION_MODES["always"]:
            return True
        if _matches(exc_type, core.get_never_stop_excepts()):
            return False
        if _matches(exc_type, core.get_always_stop_excepts()):
            return True
        if mode == EXCEPTION_MODES["never"]:
            return False
        return self.predict_catch(stop.frame, stop.exc[1] if stop.exc[1] is not None
                                  else exc_type).kind == "uncaught"

    def _apply_changed(self, changed, stop):
        """Brings the breakpoint table up to date; answers the breakpoint of this stop's line
        that was hit, if any."""
        deleted, updated = changed if changed else ((), ())
        hit = None
        place = self.place(stop.frame, stop.thread)
        here = (os.path.abspath(place.file) if not place.sub_language else place.file,
                place.line)
        for data in updated:
            _file, line, core_id, enabled, temporary, cond, ignore, hits = data
            number = self._core_ids.get(core_id)
            bp = self.breakpoints.get(number)
            if bp is None:
                continue
            grew = hits > bp.hits
            bp.enabled, bp.ignore_count, bp.hits = bool(enabled), ignore, hits
            if grew and (bp.file, bp.line) == here and stop.kind == "line":
                hit = bp
        for core_id in deleted:
            number = self._core_ids.pop(core_id, None)
            bp = self.breakpoints.pop(number, None)
            if bp is not None:
                bp.hits += 1
                stop.deleted.append(bp)
                if (bp.file, bp.line) == here:
                    hit = bp
        return hit

    def _predict(self, stop):
        exc_type, value, tb = stop.exc
        stop.catch = self.predict_catch(stop.frame, value if value is not None else exc_type)
        if stop.catch.kind == "caught":
            stop.handler = stop.catch.frame
        stop.exiting = bool(core.exiting_on_exception())
        entries = _traceback_entries(tb)
        stop.inner, stop.raise_line = entries[-1] if entries else (stop.frame,
                                                                   stop.frame.f_lineno)
        below = _below(entries, stop.frame)
        stop.finished = [frame for frame, _line in below if not self._is_internal(frame)]
        self._finished_lines = dict(below)
        stop.chain = exception_chain(value) or [ChainLink(value)]
        stop.chain[0].tb = tb

    def predict_catch(self, frame, exc):
        """The core's answer to what will end `exc` raised in (or passing through) `frame`.
        The debugger's own frames catch nothing of the program: an answer that points at
        one means the exception is not caught. An answer the core cannot give (it failed)
        counts as not caught, as the core counts it when it decides whether to stop."""
        try:
            kind, catcher, file, line = core.analysis.predict_catch(frame, exc)
        except Exception:
            return Catch("uncaught")
        if kind == "caught" and catcher is None or \
                catcher is not None and self._is_internal(catcher):
            return Catch("uncaught")
        return Catch(kind, catcher, file, line)

    # ---- resume commands (a front end calls one, then returns from stopped()) -------------

    def _set_resume(self, *command):
        if self.stop is None:
            raise SessionError("the program is not stopped")
        self._resume = command

    def step(self):
        self._set_resume("step_into")

    def next(self):
        self._set_resume("step_into" if self._returning_to_key_frame() else "step_over")

    def step_out(self):
        self._set_resume("step_into" if self._returning_to_key_frame() else "step_out")

    def _returning_to_key_frame(self):
        """Whether the program stands at the return of a Python function that a
        sub-language's key frame called (a function a template line calls). Stepping over
        or out of it means stopping at what comes next in the template; the core would take
        either for running freely once the function is gone, since the template's lines are
        no Python lines of the caller, so the next event is asked for instead: the next
        template line (or the next function the same line calls)."""
        stop = self.stop
        return (stop is not None and stop.kind == "return" and self.frame is stop.frame
                and self.frame_category(stop.frame.f_back, stop.thread) == KEY_FRAME)

    def cont(self):
        self._set_resume("continue_run")

    def until(self, line=None):
        """Runs until a line below `line` (default: the current line) is passed in the
        current frame, or the frame returns."""
        if self.stop is not None and self._key_hook(self.stop.frame) is not None:
            raise SessionError("until works in Python code; `next` steps over a template "
                               "line")
        current = self.stop.frame.f_lineno
        last = current if line is None else line - 1
        if line is not None and line <= current:
            raise SessionError(f"line {line} is not after the current line {current}")
        self._set_resume("step_over_line_range", 0, last)

    def quit(self):
        self._set_resume("quit")

    def jump(self, line):
        """Makes `line` the next line to run in the stopped frame.

        Only that frame, and only at a line stop. Setting the line of any other frame (a
        caller, or a frame of another thread) is accepted by 3.13 to 3.15 and then crashes
        the interpreter when that frame resumes; at a return stop the frame is leaving (and
        at a generator's yield, 3.14 and later give up the yield in progress); at an
        exception stop the exception is on its way. None of these is attempted."""
        stop = self.stop
        if stop is None:
            raise SessionError("the program is not stopped")
        if self.is_finished(self.frame):
            raise SessionError("cannot jump in a finished frame (the exception has left it)")
        if self.frame is not stop.frame:
            where = ("go back there with `down`" if self._is_caller(self.frame, stop.frame)
                     else "select it with `thread` and `down`")
            raise SessionError("can only jump in the frame where the program stopped, not "
                               f"in another frame ({where})")
        if stop.kind == "return":
            leaving = ("is suspending at a yield" if _suspends(stop.frame)
                       else "is returning")
            raise SessionError(f"cannot jump here: the function {leaving}; jump works at a "
                               "line stop (`step` to one first)")
        if stop.kind != "line":
            raise SessionError(f"cannot jump at an {stop.kind} stop: jump works at a line "
                               "stop (`step` to one first)")
        if self._key_hook(stop.frame) is not None:
            raise SessionError("cannot jump in a sub-language's code, only in Python code")
        try:
            stop.frame.f_lineno = line
        except ValueError as error:
            raise SessionError(f"cannot jump to line {line}: {error}") from None

    @staticmethod
    def _is_caller(frame, of):
        """Whether `frame` is one of the frames that led to `of`."""
        while of is not None:
            of = of.f_back
            if of is frame:
                return True
        return False

    # ---- frames and threads ----------------------------------------------------------------

    def stack(self, frame=None):
        """The program's frames from the outermost to `frame` (default: the thread's
        innermost), without the debugger's own. At an exception stop of the thread shown,
        the default is the frames of the exception selected (`select_exception`): for the
        stop's own exception, the stack and below it the frames the exception has left (to
        where it was raised); for an exception of its chain, its traceback's frames."""
        if frame is None and self._view is not None and self.stop is not None \
                and self.thread == self.stop.thread:
            return list(self._view)
        frame = frame if frame is not None else self._innermost()
        frames = []
        while frame is not None:
            if self._is_internal(frame):
                if frames:
                    break  # the debugger's runner: what lies beyond it is not the program's
            elif self.frame_category(frame) != IMPLEMENTATION_FRAME:
                frames.append(frame)
            frame = frame.f_back
        frames.reverse()
        return frames

    def _innermost(self):
        if self.stop is not None and self.thread == self.stop.thread:
            return self.stop.frame
        return self._thread_frame(self.thread)

    def _thread_frame(self, ident):
        for tid in core.get_threads():
            if core.get_thread_ident_for_tstate_id(tid) == ident:
                return self._visible(core.get_curr_frame(tid), ident)
        return None

    def _visible(self, frame, ident):
        """The frame itself, or the nearest caller that is not a sub-language's
        implementation (where another thread may be running)."""
        while frame is not None and self.frame_category(frame, ident) == IMPLEMENTATION_FRAME:
            frame = frame.f_back
        return frame

    def is_finished(self, frame):
        """Whether `frame` is one the exception shown has left (or a frame of a chained
        exception's traceback that no longer runs): it can be read, not changed."""
        return frame is not None and any(frame is known for known in self._finished)

    def frame_line(self, frame):
        """The line a frame stands at as shown: for a frame of an exception's traceback, the
        line the exception passed through there."""
        for known, line in self._frame_lines:
            if known is frame:
                return line
        return frame.f_lineno

    def _exception_stop(self):
        stop = self.stop
        if stop is None or stop.kind != "exception":
            raise SessionError("not stopped at an exception")
        return stop

    def exception_list(self):
        """The exceptions of the stop's chain, the oldest first (its last item is the
        exception of the stop), and the number of the one selected."""
        stop = self._exception_stop()
        links = list(reversed(stop.chain))
        return links, self._selected_exception

    def raise_site(self):
        """The frame where the exception shown was raised, or None."""
        stop = self.stop
        if stop is None or stop.kind != "exception" or self._selected_exception is None:
            return None
        links = list(reversed(stop.chain))
        if self._selected_exception == len(links) - 1:
            return stop.inner
        return links[self._selected_exception].raise_site[0]

    def select_exception(self, number):
        """Shows the frames of exception `number` of `exception_list()`, selecting the frame
        where it was raised; answers (its ChainLink, that frame)."""
        stop = self._exception_stop()
        links = list(reversed(stop.chain))
        if not 0 <= number < len(links):
            last = len(links) - 1
            raise SessionError(f"no exception {number}: "
                               + ("the only one is 0" if last == 0 else
                                  f"they are numbered 0 to {last}"))
        self.thread = stop.thread
        self._selected_exception = number
        self._show_exception(links[number])
        return links[number], self.frame

    def _show_exception(self, link):
        """Makes the frames of `link`'s exception the ones shown, its raise site selected."""
        stop = self.stop
        live = self.stack(stop.frame)
        if link is stop.chain[0]:
            frames = live + stop.finished
            lines = self._finished_lines
        else:
            traced = [(frame, line) for frame, line in _traceback_entries(link.traceback)
                      if not self._is_internal(frame)
                      and self.frame_category(frame) != IMPLEMENTATION_FRAME]
            frames = [frame for frame, _line in traced]
            # Where the traceback starts in a frame that still runs, its callers are shown
            # too: they are where the program is.
            if frames and any(frames[0] is frame for frame in live):
                index = next(i for i, frame in enumerate(live) if frame is frames[0])
                frames = live[:index] + frames
            lines = dict(traced)
        self._view = frames
        self._frame_lines = list(lines.items())
        self._finished = [frame for frame in frames if not any(frame is f for f in live)]
        raised = link.raise_site[0] if link is not stop.chain[0] else stop.inner
        self.frame = next((frame for frame in frames if frame is raised),
                          frames[-1] if frames else stop.frame)

    def move(self, count):
        """Selects the frame `count` levels out (positive) or in (negative)."""
        frames = self.stack()
        if not frames:
            raise SessionError("no frame to show")
        index = frames.index(self.frame) if self.frame in frames else len(frames) - 1
        target = index - count
        if target < 0:
            raise SessionError("oldest frame")
        if target >= len(frames):
            raise SessionError("newest frame")
        self.frame = frames[target]
        return self.frame

    def threads(self):
        """The live threads the core knows, numbered in the order first seen."""
        result = []
        active = dict(threading._active)  # no lock: a waiting thread may hold it
        seen = set()
        for tid in core.get_threads():
            ident = core.get_thread_ident_for_tstate_id(tid)
            if ident is None or ident in seen or ident not in active:
                continue
            seen.add(ident)
            number = self._thread_numbers.setdefault(ident, len(self._thread_numbers) + 1)
            stopped = self.stop is not None and ident == self.stop.thread
            frame = self.stop.frame if stopped else self._visible(core.get_curr_frame(tid),
                                                                   ident)
            if frame is not None and self._is_internal(frame):
                frame = None
            result.append(ThreadInfo(number, ident, active[ident].name, frame, stopped))
        result.sort(key=lambda t: t.number)
        return result

    def thread_name(self, ident):
        thread = threading._active.get(ident)
        return thread.name if thread is not None else f"thread {ident}"

    def select_thread(self, number):
        for info in self.threads():
            if info.number == number:
                if info.frame is None:
                    raise SessionError(f"thread {number} ({info.name}) is running outside "
                                       "the program's traced code")
                self.thread = info.ident
                self.frame = info.frame
                return info
        raise SessionError(f"no thread {number}; `threads` lists them")

    # ---- breakpoints -----------------------------------------------------------------------

    def resolve_file(self, name):
        """An absolute path for a file name given by the person: relative to the working
        directory, else found on sys.path, else the file of the selected frame's module."""
        candidates = [os.path.abspath(name)]
        if not os.path.isabs(name):
            candidates += [os.path.join(p or os.getcwd(), name) for p in sys.path]
        for path in candidates:
            if os.path.isfile(path):
                return os.path.abspath(path)
        raise SessionError(f"no file {name!r}")

    def parse_location(self, location):
        """`[FILE:]LINE` or a function name -> (file, line)."""
        location = location.strip()
        if not location:
            raise SessionError("a location is needed: [FILE:]LINE or FUNCTION")
        file, _, line = location.rpartition(":")
        if line.strip().isdigit():
            if file:
                path = self.resolve_file(file.strip())
            elif self.frame is not None:
                path = self.place(self.frame).file
                if not self.place(self.frame).sub_language:
                    path = os.path.abspath(path)
            elif self.main_file:
                path = self.main_file
            else:
                raise SessionError("no current file: give FILE:LINE")
            return path, int(line)
        if ":" in location:
            raise SessionError(f"bad location {location!r}: expected [FILE:]LINE or FUNCTION")
        return self._function_location(location)

    main_file = None

    def _function_location(self, name):
        if self.frame is None:
            raise SessionError(f"cannot find function {name!r} before the program runs; "
                               "give FILE:LINE")
        if not all(part.isidentifier() for part in name.split(".")):
            raise SessionError(f"bad location {name!r}: expected [FILE:]LINE or FUNCTION")
        try:
            function = self.evaluate(name)
        except Exception as error:
            raise SessionError(f"no function {name!r}: {_one_line(error)}") from None
        code = getattr(getattr(function, "__func__", function), "__code__", None)
        if code is None:
            raise SessionError(f"{name!r} is not a Python function")
        lines = sorted(line for _, line in dis.findlinestarts(code)
                       if line is not None and line > code.co_firstlineno)
        return os.path.abspath(code.co_filename), (lines[0] if lines else code.co_firstlineno)

    def add_breakpoint(self, location, condition=None, temporary=False):
        path, line = self.parse_location(location)
        source = linecache.getline(path, line)
        if not source:
            raise SessionError(f"{_show_path(path)} has no line {line}")
        # Any other file is a sub-language's (a template): the core compares its name, as
        # given here, with the hook's translation of key frames, and the hook evaluates its
        # conditions in the sub-language's own terms.
        if _is_python_file(path):
            stripped = source.strip()
            if not stripped or stripped.startswith("#"):
                raise SessionError(f"line {line} of {_show_path(path)} is blank or a comment")
            _check_condition(condition)
        for bp in self.breakpoints.values():
            if (bp.file, bp.line) == (path, line):
                raise SessionError(f"breakpoint {bp.number} is already at "
                                   f"{_show_path(path)}:{line}")
        core_id = core.set_break(path, line, 1, 1 if temporary else 0, condition, 0)
        bp = Breakpoint(self._next_number, path, line, temporary, True, condition)
        self._next_number += 1
        self.breakpoints[bp.number] = bp
        self._core_ids[core_id] = bp.number
        return bp

    def breakpoint(self, number):
        try:
            return self.breakpoints[int(number)]
        except (ValueError, KeyError):
            raise SessionError(f"no breakpoint {number}") from None

    def clear_breakpoint(self, number):
        bp = self.breakpoint(number)
        core.clear_breaks(bp.file, bp.line)
        del self.breakpoints[bp.number]
        for core_id, known in list(self._core_ids.items()):
            if known == bp.number:
                del self._core_ids[core_id]
        return bp

    def enable_breakpoint(self, number, enabled=True):
        bp = self.breakpoint(number)
        core.enable_breaks(bp.file, bp.line, 1 if enabled else 0)
        bp.enabled = enabled
        return bp

    def set_condition(self, number, condition):
        bp = self.breakpoint(number)
        if condition and _is_python_file(bp.file):
            _check_condition(condition)
        core.set_breaks_cond(bp.file, bp.line, condition or None)
        bp.condition = condition or None
        return bp

    def set_ignore(self, number, count):
        bp = self.breakpoint(number)
        if count < 0:
            raise SessionError("an ignore count cannot be negative")
        core.ignore_breaks(bp.file, bp.line, count)
        bp.ignore_count = count
        return bp

    def breakpoint_lines(self, path):
        return {bp.line for bp in self.breakpoints.values() if bp.file == path}

    # ---- exceptions ------------------------------------------------------------------------

    def exception_mode(self):
        mode = core.get_exception_mode()
        return next((name for name, value in EXCEPTION_MODES.items() if value == mode),
                    str(mode))

    def set_exception_mode(self, name):
        if name not in EXCEPTION_MODES:
            raise SessionError(f"unknown exception mode {name!r}: one of "
                               + ", ".join(EXCEPTION_MODES))
        core.set_exception_mode(EXCEPTION_MODES[name])

    def _exception_types(self, names):
        types = []
        for name in names:
            try:
                value = self.evaluate(name) if self.frame is not None else \
                    getattr(builtins, name)
            except Exception:
                raise SessionError(f"no exception type {name!r}") from None
            if not (isinstance(value, type) and issubclass(value, BaseException)):
                raise SessionError(f"{name!r} is not an exception type")
            types.append(value)
        return tuple(types)

    def prints_exceptions(self, frame):
        """Whether the frame runs a function of the catch-info list that prints what it
        catches (where the "printed" mode stops)."""
        if core.get_exception_mode() not in (4, 5):
            return False
        code = frame.f_code
        module = frame.f_globals.get("__name__")
        for info in self.catch_info:
            if info.co_name == code.co_name and info.mod_name in ("*", module) \
                    and info.prints and not info.parent:
                return True
        return False

    def set_always_stop(self, names):
        core.set_always_stop_excepts(self._exception_types(names))

    def set_never_stop(self, names):
        core.set_never_stop_excepts(self._exception_types(names))

    def always_stop(self):
        return core.get_always_stop_excepts()

    def never_stop(self):
        return core.get_never_stop_excepts()

    def ignore_here(self):
        """Exceptions at the place where the current exception was raised stop no more."""
        stop = self.stop
        if stop is None or stop.kind != "exception":
            raise SessionError("not stopped at an exception")
        inner = stop.inner
        place = self.place(inner)
        if place.sub_language:  # the core filters a key frame's exceptions by its translation
            path, line = place.file, place.line
        else:
            path, line = core.get_frame_file(inner), stop.raise_line
        core.ignore_exception_loc(path, line, 1)
        return path, line

    # ---- evaluation ------------------------------------------------------------------------

    def namespaces(self, frame=None):
        frame = frame if frame is not None else self.frame
        if frame is None:
            raise SessionError("no frame to evaluate in")
        return frame.f_globals, frame.f_locals

    def evaluate(self, expression, frame=None):
        """The value of an expression in the selected frame; its exceptions propagate. At a
        sub-language's key frame the hook evaluates it, in the sub-language's variables."""
        hook = self._key_hook(frame if frame is not None else self.frame)
        if hook is not None:
            return hook._Eval(expression, frame if frame is not None else self.frame)
        globals_, locals_ = self.namespaces(frame)
        code = compile(expression, "<selvane>", "eval")
        return eval(code, globals_, locals_)

    def execute(self, statement, frame=None):
        """Runs a statement in the selected frame; assignments to local variables reach the
        running function."""
        frame = frame if frame is not None else self.frame
        if self._key_hook(frame) is not None:
            raise SessionError("statements cannot run in a sub-language's variables; "
                               "`p EXPRESSION` evaluates there")
        if self.is_finished(frame):
            raise SessionError("cannot change a finished frame (the exception has left it); "
                               "expressions can still be evaluated in it")
        globals_, locals_ = self.namespaces(frame)
        code = compile(statement + "\n", "<selvane>", "single")
        try:
            exec(code, globals_, locals_)
        finally:
            if sys.version_info < (3, 13) and locals_ is not globals_:
                # 3.11 and 3.12 hand out a copy of the fast locals; write it back.
                core.locals_to_fast(frame)

    def names(self, frame=None):
        frame = frame if frame is not None else self.frame
        if self._key_hook(frame) is not None:
            try:
                return set(self.local_variables(frame)) | set(dir(builtins))
            except SessionError:
                return set(dir(builtins))
        globals_, locals_ = self.namespaces(frame)
        return set(locals_) | set(globals_) | set(dir(builtins))

    def local_variables(self, frame=None):
        """The variables of the frame: its locals, or at a key frame the sub-language's
        variables when its hook can tell them (a method `variables(frame)`)."""
        frame = frame if frame is not None else self.frame
        if frame is None:
            raise SessionError("no frame to show")
        hook = self._key_hook(frame)
        if hook is None:
            return dict(frame.f_locals)
        variables = getattr(hook, "variables", None)
        if variables is None:
            raise SessionError("this sub-language's hook does not list its variables; "
                               "`p NAME` shows one")
        try:
            return dict(variables(frame))
        except Exception as error:
            raise SessionError(f"the sub-language's variables: {_one_line(error)}") from None

    # ---- sub-languages ----------------------------------------------------------------------

    def register_sub_language_hook(self, hook):
        """Registers a sub-language's hook with the core (once per hook: the core keeps every
        hook it was given until the session ends)."""
        try:
            check_hook(hook)
        except TypeError as error:
            raise SessionError(str(error)) from None
        if any(known is hook for known in self.sub_language_hooks):
            return
        register = getattr(core, "register_sub_language_hook", None)
        if register is None:
            raise SessionError("this build of the debugger core has no sub-language support")
        register(hook)
        self.sub_language_hooks.append(hook)

    def frame_category(self, frame, ident=None):
        """KEY_FRAME for a registered sub-language's key frame, IMPLEMENTATION_FRAME for the
        rest of its implementation while it runs, -1 for every other frame. `ident` is the
        frame's thread (default: the thread shown)."""
        if not self.sub_language_hooks or frame is None:
            return -1
        tid = self._tstate_id(ident)
        if tid is None:
            return -1
        try:
            return core.sub_language_get_frame_category(tid, frame)
        except Exception:
            return -1

    def place(self, frame, ident=None):
        """Where the frame stands: its Python place, or for a key frame the hook's
        translation (the Python place if the hook cannot translate it)."""
        hook = self._key_hook(frame, ident)
        if hook is not None:
            try:
                file, line = hook._TranslateFrame(frame, 0)[:2]
                return Place(str(file), int(line))
            except Exception:
                pass
        return Place(frame.f_code.co_filename, self.frame_line(frame), frame.f_code.co_name)

    def source(self, frame, line=None):
        """The text of the frame's line (or of another line of its file), stripped, or
        None."""
        place = self.place(frame)
        line = place.line if line is None else line
        if place.sub_language:
            text = linecache.getline(place.file, line)
        else:
            text = linecache.getline(place.file, line, frame.f_globals)
        return text.strip() if text else None

    def _key_hook(self, frame, ident=None):
        """The hook of the sub-language whose key frame this is, or None."""
        if frame is None or self.frame_category(frame, ident) != KEY_FRAME:
            return None
        for hook in self.sub_language_hooks:
            try:
                if frame.f_code in hook._GetSubLanguageFrames():
                    return hook
            except Exception:
                continue
        tid = self._tstate_id(ident)
        try:
            return core.sub_language_get_active_hook(tid)
        except Exception:
            return None

    def _tstate_id(self, ident=None):
        if ident is None:
            ident = self.thread if self.thread is not None else threading.get_ident()
        if ident == threading.get_ident():
            return core.get_current_tstate_id()
        for tid in core.get_threads():
            if core.get_thread_ident_for_tstate_id(tid) == ident:
                return tid
        return None

    def take_new_imports(self):
        return list(core.get_new_imports())


def library_paths(extra=()):
    """The folders (or files) whose code is library code rather than the program's own: the
    interpreter's standard library, the site-packages folders, the user's site-packages, and
    `extra` (paths the person gives, relative to the working directory). Each is given as
    written and as its real path, since a code object's file name may carry either."""
    found = [os.path.dirname(os.__file__)]
    site = sys.modules.get("site")  # loaded at start-up unless the interpreter ran with -S
    try:
        found.extend(site.getsitepackages())
    except Exception:
        pass
    # Read, not asked for: site.getusersitepackages() would set the module's USER_SITE
    # where the interpreter left it unset (-s), which the program could see.
    user_site = getattr(site, "USER_SITE", None)
    if isinstance(user_site, str):
        found.append(user_site)
    for path in extra:
        if not os.path.exists(path):
            raise SessionError(f"no file or folder {path!r}")
        found.append(path)
    paths = []
    for path in found:
        for form in (os.path.abspath(path), os.path.realpath(path)):
            if form not in paths:
                paths.append(form)
    return paths


def _traceback_entries(tb):
    """(frame, line) of each entry of a traceback, the outermost first."""
    entries = []
    while tb is not None and len(entries) < _MAX_TRACEBACK:
        entries.append((tb.tb_frame, tb.tb_lineno))
        tb = tb.tb_next
    return entries


_MAX_TRACEBACK = 10000


def _below(entries, frame):
    """The traceback entries below the last entry of `frame`: the frames an exception
    reported in `frame` has already left, down to where it was raised."""
    last = max((i for i, (known, _line) in enumerate(entries) if known is frame), default=None)
    return entries[last + 1:] if last is not None else []


def exception_chain(exc):
    """The exception and those it was raised from (`__cause__`) or while handling
    (`__context__`, unless suppressed), as the interpreter prints them: a ChainLink each,
    the exception itself first."""
    links = []
    seen = set()
    relation = None
    while isinstance(exc, BaseException) and id(exc) not in seen and len(links) < 100:
        seen.add(id(exc))
        links.append(ChainLink(exc, relation))
        if exc.__cause__ is not None:
            exc, relation = exc.__cause__, "cause"
        elif exc.__context__ is not None and not exc.__suppress_context__:
            exc, relation = exc.__context__, "context"
        else:
            break
    return links


def _is_python_file(path):
    return path.endswith((".py", ".pyw"))


def _check_condition(condition):
    if condition is not None:
        try:
            compile(condition, "<condition>", "eval")
        except SyntaxError as error:
            raise SessionError(f"bad condition {condition!r}: {error.msg}") from None


def _matches(exc_type, types):
    try:
        return bool(types) and issubclass(exc_type, tuple(types))
    except TypeError:
        return False


def load_sub_language_hook(spec):
    """A hook named `MODULE:OBJECT` (as --sub-language gives it): the object, or, for a class
    or a factory, what calling it without arguments answers."""
    module_name, sep, attribute = spec.partition(":")
    if not sep or not module_name.strip() or not attribute.strip():
        raise SessionError(f"expected MODULE:OBJECT, not {spec!r}")
    try:
        module = importlib.import_module(module_name.strip())
    except Exception as error:
        raise SessionError(f"cannot import {module_name.strip()}: {_one_line(error)}") from None
    try:
        value = functools.reduce(getattr, attribute.strip().split("."), module)
    except AttributeError:
        raise SessionError(f"module {module_name.strip()} has no {attribute.strip()}") from None
    if isinstance(value, type) or not all(hasattr(value, name) for name in HOOK_METHODS):
        if not callable(value):
            raise SessionError(f"{spec} is neither a sub-language hook nor callable")
        try:
            value = value()
        except Exception as error:
            raise SessionError(f"{spec}(): {_one_line(error)}") from None
    try:
        check_hook(value)
    except TypeError as error:
        raise SessionError(str(error)) from None
    return value


_current = None  # the session that initialised the core last


def _register_from_program(hook):
    """selvane.register_sub_language_hook() while this module is loaded: the hook goes to the
    current session too. A problem of the debugger is told to the person debugging, not
    raised into the program."""
    session = _current
    if session is not None:
        try:
            session.register_sub_language_hook(hook)
        except SessionError as error:
            session.frontend.message(f"sub-language hook not registered: {error}")


def _one_line(error):
    text = str(error)
    return f"{type(error).__name__}: {text}" if text else type(error).__name__


def _show_path(path):
    """A path as the person reads it: relative to the working directory when the file is
    under it, else absolute (never a climb of "../" up to the root)."""
    try:
        relative = os.path.relpath(path)
    except ValueError:
        return os.path.abspath(path)
    if relative == os.pardir or relative.startswith(os.pardir + os.sep):
        return os.path.abspath(path)
    return relative


def _exit_now():
    """Ends the process at once: the person quit, no more of the program runs. What the
    program has written so far still reaches its files."""
    for stream in (sys.stdout, sys.stderr, sys.__stdout__, sys.__stderr__):
        try:
            stream.flush()
        except Exception:
            pass
    os._exit(1)
