"""The console front end: shows each stop of the debugging session and reads the person's
commands from the terminal.

The console reads and writes the terminal, never the program's standard streams: with a
terminal on both standard input and output it uses copies of them (and `input()`, which gives
line editing, history and completion, while the program leaves them in place); otherwise it
opens /dev/tty, so that a program reading its standard input from a file or a pipe still
gets all of it. The session (`selvane.session`) does the debugging; this module only turns
commands into session calls and results into text.
"""

import cmd
import glob
import linecache
import os
import pprint
import reprlib
import sys
import threading

from .session import Frontend, Session, SessionError, _own_files, _show_path

PROMPT = "(selvane) "


class Terminal:
    """Where the console reads commands and writes what it shows.

    With the terminal on the standard streams, the console keeps streams of its own on
    copies of their file descriptors: a program that points descriptors 0 and 1 elsewhere
    (pytest's output capture does) still leaves the console on the terminal. The line editor
    (input()) is used while the standard streams are still the terminal."""

    def __init__(self, stdin, stdout, line_editing, editor_streams=None):
        self.stdin = stdin
        self.stdout = stdout
        self.line_editing = line_editing
        self._editor_streams = editor_streams  # (sys.stdin, sys.stdout) as they were

    @classmethod
    def open(cls):
        stdin, stdout = sys.stdin, sys.stdout
        if _isatty(stdin) and _isatty(stdout):
            try:
                own_in = os.fdopen(os.dup(stdin.fileno()), "r")
                own_out = os.fdopen(os.dup(stdout.fileno()), "w", buffering=1)
            except (OSError, ValueError):
                return cls(stdin, stdout, True, (stdin, stdout))
            return cls(own_in, own_out, True, (stdin, stdout))
        try:
            tty_in = open("/dev/tty", "r")
            tty_out = open("/dev/tty", "w", buffering=1)
            return cls(tty_in, tty_out, False)
        except OSError:
            return cls(stdin, sys.stderr, False)

    def editor_usable(self):
        """Whether input() would read and write this terminal: the standard streams are
        still the ones the console started with, on the same files."""
        if not self.line_editing or self._editor_streams != (sys.stdin, sys.stdout):
            return False
        try:
            return all(_same_file(mine.fileno(), standard.fileno())
                       for mine, standard in zip((self.stdin, self.stdout),
                                                 self._editor_streams))
        except (OSError, ValueError):
            return False


def _same_file(fd, other):
    one, two = os.fstat(fd), os.fstat(other)
    return (one.st_dev, one.st_ino, one.st_rdev) == (two.st_dev, two.st_ino, two.st_rdev)


def _isatty(stream):
    try:
        return stream is not None and stream.isatty()
    except (ValueError, OSError):
        return False


_short_repr = reprlib.Repr()
_short_repr.maxstring = 80
_short_repr.maxother = 80


class Console(cmd.Cmd, Frontend):
    prompt = PROMPT
    doc_header = "Commands (`help COMMAND` tells more):"
    ruler = ""

    def __init__(self, terminal, commands=()):
        super().__init__(stdin=terminal.stdin, stdout=terminal.stdout)
        self.terminal = terminal
        self.use_rawinput = False  # the reading is ours: see _read_line
        self.session = None
        self.cmdqueue = list(commands)
        self._resumed = False
        self._list_next = None  # (file, first line) where a bare `list` goes on
        self._displayed_thread = None

    # ---- output ----------------------------------------------------------------------------

    def say(self, text=""):
        self.stdout.write(text + "\n")
        self.stdout.flush()

    def error(self, text):
        self.say(f"*** {text}")

    def message(self, text):
        self.say(text)

    # ---- the session's stops ---------------------------------------------------------------

    def stopped(self, session, stop):
        self.session = session
        _flush_program_output()
        self._list_next = None
        self.show_stop(stop)
        self._resumed = False
        completer = self._take_completer()
        try:
            while not self._resumed:
                if self.cmdqueue:
                    line = self.cmdqueue.pop(0)
                else:
                    line = self._read_line()
                if line is None:  # end of input
                    self.say("quit")
                    session.quit()
                    break
                try:
                    self.onecmd(self.precmd(line))
                except SessionError as error:
                    self.error(str(error))
        finally:
            self._give_back_completer(completer)

    def _read_line(self):
        session = self.session
        terminal = self.terminal
        # input() reads sys.stdin and writes sys.stdout: only while they are still the
        # terminal we were given (a program may have replaced them).
        editing = terminal.editor_usable()
        while True:
            session._at_prompt = True
            try:
                if editing:
                    return input(self.prompt)
                self.stdout.write(self.prompt)
                self.stdout.flush()
                line = self.stdin.readline()
                return line.rstrip("\r\n") if line else None
            except EOFError:
                return None
            except KeyboardInterrupt:
                self.say("")
            finally:
                session._at_prompt = False

    def _take_completer(self):
        if not self.terminal.line_editing:
            return None
        try:
            import readline
        except ImportError:
            return None
        saved = (readline.get_completer(), readline.get_completer_delims())
        readline.set_completer(self.complete)
        readline.set_completer_delims(" \t\n`~!@#$%^&*()=+[{]}\\|;:'\",<>?")
        readline.parse_and_bind("tab: complete")
        return saved

    def _give_back_completer(self, saved):
        if saved is None:
            return
        import readline
        readline.set_completer(saved[0])
        readline.set_completer_delims(saved[1])

    def show_stop(self, stop):
        session = self.session
        threads = session.threads()
        header = f"> {self._where(stop.frame)}"
        if len(threads) > 1:
            header += f"  [{session.thread_name(stop.thread)}]"
        if stop.reason:
            header += f"  ({stop.reason})"
        if stop.reason == "interrupted":
            self.say("")  # past the ^C that the terminal echoed
        self.say(header)
        self.say(f"-> {self._source(stop.frame)}")
        for bp in stop.deleted:
            self.say(f"(temporary breakpoint {bp.number} deleted)")
        if stop.kind == "return":
            self.say(f"<- {stop.frame.f_code.co_name}() returns {_short_repr.repr(stop.value)}")
        elif stop.kind == "exception":
            exc_type, value, _tb = stop.exc
            self.say(f"!! {_exception_text(exc_type, value)}")
            if stop.inner is not None and stop.inner is not stop.frame:
                self.say(f"   raised at {self._where(stop.inner)}")
            self.say(f"   ({self._catch_text(stop)})")
            for link in stop.chain[1:]:
                relation = "caused by" if link.relation == "cause" else "while handling"
                self.say(f"   {relation} {self._link_text(link)}")

    def _catch_text(self, stop):
        catch = stop.catch
        kind = catch.kind if catch is not None else "uncaught"
        if kind == "caught" and catch.frame is not None:
            return f"will be caught in {self._where(catch.frame)}"
        if kind == "c-code":
            return f"may be caught by C code called at {_show_path(catch.file)}:{catch.line}"
        if kind == "with":
            return f"a `with` at {_show_path(catch.file)}:{catch.line} may suppress it"
        if self.session.prints_exceptions(stop.frame):
            return "caught here and printed"
        if stop.thread == threading.main_thread().ident:
            return "not caught: the program ends with it"
        return "not caught: the thread ends with it"

    def _link_text(self, link):
        """An exception of a chain in one line: what it is and where it was raised."""
        text = _exception_text(type(link.exc), link.exc)
        frame, line = link.raise_site
        if frame is not None:
            text += f"  (raised at {_show_path(frame.f_code.co_filename)}:{line} in " \
                    f"{frame.f_code.co_name}())"
        return text

    def _where(self, frame):
        place = self.session.place(frame)
        if place.sub_language:  # a template line (or another sub-language's step)
            return f"{_show_path(place.file)}:{place.line}"
        return f"{_show_path(place.file)}:{place.line} in {place.function}()"

    def _source(self, frame, line=None):
        text = self.session.source(frame, line)
        return text if text is not None else "<no source>"

    # ---- command parsing -------------------------------------------------------------------

    def precmd(self, line):
        stripped = line.strip()
        if stripped == "ignore-here":
            return "ignore_here"
        return line

    def emptyline(self):
        pass  # unlike pdb, an empty line does not repeat: a stray Enter never steps

    def default(self, line):
        if line.startswith("!"):
            line = line[1:]
        self._run_python(line)

    def _run_python(self, text):
        session = self.session
        try:
            code_is_expression = True
            try:
                compile(text, "<selvane>", "eval")
            except SyntaxError:
                code_is_expression = False
            if code_is_expression:
                value = session.evaluate(text)
                if value is not None:
                    self.say(repr(value))
            else:
                try:
                    compile(text + "\n", "<selvane>", "single")
                except SyntaxError as error:
                    word = text.split()[0] if text.split() else text
                    if word.isidentifier() and not text.strip().startswith("!"):
                        self.error(f"unknown command or invalid Python: {text.strip()!r} "
                                   f"({error.msg}); `help` lists the commands")
                    else:
                        self.error(f"SyntaxError: {error.msg}")
                    return
                session.execute(text)
        except SessionError:
            raise
        except Exception as error:
            self.error(_exception_text(type(error), error))

    def completenames(self, text, *ignored):
        names = super().completenames(text, *ignored)
        if self.session is not None and self.session.frame is not None:
            names += [n for n in self.session.names() if n.startswith(text)]
        return sorted(set(names))

    def completedefault(self, text, line, begidx, endidx):
        if self.session is None or self.session.frame is None:
            return []
        return sorted(n for n in self.session.names() if n.startswith(text))

    def _complete_location(self, text, line, begidx, endidx):
        matches = [p + ("/" if os.path.isdir(p) else ":") for p in glob.glob(text + "*")
                   if os.path.isdir(p) or p.endswith(".py")]
        if self.session is not None and self.session.frame is not None:
            matches += [n for n in self.session.names() if n.startswith(text)]
        return sorted(matches)

    complete_break = complete_b = complete_tbreak = _complete_location

    # ---- help ------------------------------------------------------------------------------

    def do_help(self, arg):
        """help [COMMAND]: list the commands, or tell what one does."""
        arg = arg.strip()
        if arg:
            name = _ALIASES.get(arg, arg)
            method = getattr(self, "do_" + name.replace("-", "_"), None)
            if method is None or not method.__doc__:
                self.error(f"no command {arg!r}")
                return
            self.say(_dedent(method.__doc__))
            return
        self.say(self.doc_header)
        for name, summary in _SUMMARY:
            self.say(f"  {name:<28} {summary}")
        self.say("Anything else is run as Python in the selected frame "
                 "(`!` forces it: `!n = 3`).")

    do_h = do_help

    # ---- running ---------------------------------------------------------------------------

    def _resume(self, method, *args):
        method(*args)
        self._resumed = True
        return True

    def do_step(self, arg):
        """step (s): run to the next line, entering the functions it calls."""
        return self._resume(self.session.step)

    def do_next(self, arg):
        """next (n): run to the next line of this function, over the calls it makes."""
        return self._resume(self.session.next)

    def do_return(self, arg):
        """return (r): run until the current function returns."""
        return self._resume(self.session.step_out)

    def do_continue(self, arg):
        """continue (c, cont): run until a breakpoint, an exception stop or Ctrl-C."""
        return self._resume(self.session.cont)

    def do_until(self, arg):
        """until (unt) [LINE]: run until a line after the current one (or line LINE or
        later) is reached in this function, or it returns; steps over loops."""
        line = _int_arg(arg, "until") if arg.strip() else None
        return self._resume(self.session.until, line)

    def do_jump(self, arg):
        """jump (j) LINE: make LINE the next line to run in the current frame (only in the
        frame where the program stopped, at a line stop; not into or out of a loop or
        block)."""
        line = _int_arg(arg, "jump")
        self.session.jump(line)
        self.say(f"next line: {line}")
        self.say(f"-> {self._source(self.session.frame, line)}")

    def do_quit(self, arg):
        """quit (q, exit): end the debugger and the program at once."""
        return self._resume(self.session.quit)

    do_s, do_n, do_r, do_c, do_cont = do_step, do_next, do_return, do_continue, do_continue
    do_unt, do_j, do_q, do_exit = do_until, do_jump, do_quit, do_quit

    # ---- frames ----------------------------------------------------------------------------

    def do_where(self, arg):
        """where (w, bt): the stack, outermost call first; `>` marks the selected frame."""
        session = self.session
        for frame in session.stack():
            mark = ">" if frame is session.frame else " "
            self.say(f"{mark} {self._where(frame)}{self._frame_note(frame)}")
            self.say(f"    -> {self._source(frame)}")

    def _frame_note(self, frame):
        """Marks a frame the exception has left, and the place it was raised when the
        program stands elsewhere."""
        session = self.session
        notes = []
        if session.is_finished(frame):
            notes.append("finished")
        stop = session.stop
        if stop is not None and frame is session.raise_site() and frame is not stop.frame:
            notes.append("raised here")
        return f"  ({'; '.join(notes)})" if notes else ""

    do_w = do_bt = do_where

    def _move(self, arg, direction):
        count = _int_arg(arg, "count") if arg.strip() else 1
        frame = self.session.move(direction * count)
        self._list_next = None
        self.say(f"> {self._where(frame)}{self._frame_note(frame)}")
        self.say(f"-> {self._source(frame)}")

    def do_up(self, arg):
        """up (u) [COUNT]: select the frame that called this one."""
        self._move(arg, 1)

    def do_down(self, arg):
        """down (d) [COUNT]: select the frame this one called."""
        self._move(arg, -1)

    do_u, do_d = do_up, do_down

    def do_list(self, arg):
        """list (l) [FIRST[, LAST]]: source lines around the current line, or from FIRST;
        `list` again goes on after what was shown."""
        frame = self.session.frame
        place = self.session.place(frame)
        path = place.file
        arg = arg.strip()
        if arg:
            parts = [p.strip() for p in arg.split(",")]
            first = _int_arg(parts[0], "list")
            last = _int_arg(parts[1], "list") if len(parts) > 1 else first + 10
            if len(parts) == 1:
                first = max(1, first - 5)
                last = first + 10
        elif self._list_next and self._list_next[0] == path:
            first = self._list_next[1]
            last = first + 10
        else:
            first = max(1, place.line - 5)
            last = first + 10
        self._show_lines(frame, first, last)
        self._list_next = (path, last + 1)

    do_l = do_list

    def do_longlist(self, arg):
        """longlist (ll): the whole source of the current function."""
        import inspect
        frame = self.session.frame
        place = self.session.place(frame)
        try:
            if place.sub_language:  # the whole template
                lines = linecache.getlines(place.file)
                first = 1
            elif frame.f_code.co_name == "<module>":
                lines = linecache.getlines(frame.f_code.co_filename, frame.f_globals)
                first = 1
            else:
                lines, first = inspect.getsourcelines(frame.f_code)
        except (OSError, TypeError) as error:
            self.error(f"no source: {error}")
            return
        self._show_lines(frame, first, first + len(lines) - 1)

    do_ll = do_longlist

    def _show_lines(self, frame, first, last):
        place = self.session.place(frame)
        path = place.file
        marks = self.session.breakpoint_lines(path if place.sub_language
                                              else os.path.abspath(path))
        shown = False
        for line in range(first, last + 1):
            text = linecache.getline(path, line,
                                     None if place.sub_language else frame.f_globals)
            if not text:
                break
            shown = True
            mark = "->" if line == place.line else "  "
            bp = "B" if line in marks else " "
            self.say(f"{line:4d} {bp}{mark} {text.rstrip()}")
        if not shown:
            self.error("no more lines")

    # ---- values ----------------------------------------------------------------------------

    def do_p(self, arg):
        """p EXPRESSION: print the value of the expression in the selected frame."""
        self._print(arg, repr)

    def do_pp(self, arg):
        """pp EXPRESSION: pretty-print the value of the expression."""
        self._print(arg, pprint.pformat)

    def _print(self, arg, form):
        if not arg.strip():
            self.error("an expression is needed")
            return
        try:
            value = self.session.evaluate(arg.strip())
        except SyntaxError as error:
            self.error(f"SyntaxError: {error.msg}")
            return
        except Exception as error:
            self.error(_exception_text(type(error), error))
            return
        self.say(form(value))

    def do_locals(self, arg):
        """locals: the local variables of the selected frame (a template's variables at a
        template line)."""
        frame = self.session.frame
        names = self.session.local_variables(frame)
        if frame.f_code.co_name == "<module>":
            self.say("(module level: the names are its globals)")
        for name in sorted(names):
            if name.startswith("__") and name.endswith("__"):
                continue
            self.say(f"{name} = {_short_repr.repr(names[name])}")

    # ---- breakpoints -----------------------------------------------------------------------

    def do_break(self, arg, temporary=False):
        """break (b) [FILE:]LINE [, CONDITION] | FUNCTION [, CONDITION]: stop when the line
        is reached (and the condition is true); without argument, list breakpoints."""
        if not arg.strip():
            return self.do_breakpoints("")
        location, _, condition = arg.partition(",")
        condition = condition.strip() or None
        bp = self.session.add_breakpoint(location, condition, temporary)
        kind = "Temporary breakpoint" if temporary else "Breakpoint"
        text = f"{kind} {bp.number} at {_show_path(bp.file)}:{bp.line}"
        if condition:
            text += f" if {condition}"
        self.say(text)

    def do_tbreak(self, arg):
        """tbreak [FILE:]LINE [, CONDITION] | FUNCTION: a breakpoint that is deleted when it
        first stops the program."""
        if not arg.strip():
            self.error("a location is needed: [FILE:]LINE or FUNCTION")
            return
        return self.do_break(arg, temporary=True)

    do_b = do_break

    def _numbers(self, arg, command):
        numbers = arg.split()
        if not numbers:
            self.error(f"{command} needs breakpoint numbers")
        return numbers

    def do_clear(self, arg):
        """clear NUMBER...: delete breakpoints (`clear` alone deletes every one)."""
        session = self.session
        numbers = arg.split() or [str(n) for n in list(session.breakpoints)]
        for number in numbers:
            try:
                bp = session.clear_breakpoint(number)
            except SessionError as error:
                self.error(str(error))
                continue
            self.say(f"Deleted breakpoint {bp.number} at {_show_path(bp.file)}:{bp.line}")

    do_cl = do_clear

    def do_disable(self, arg):
        """disable NUMBER...: keep breakpoints but do not stop at them."""
        self._enable(arg, False)

    def do_enable(self, arg):
        """enable NUMBER...: stop at these breakpoints again."""
        self._enable(arg, True)

    def _enable(self, arg, enabled):
        for number in self._numbers(arg, "enable" if enabled else "disable"):
            try:
                bp = self.session.enable_breakpoint(number, enabled)
            except SessionError as error:
                self.error(str(error))
                continue
            self.say(f"{'Enabled' if enabled else 'Disabled'} breakpoint {bp.number}")

    def do_condition(self, arg):
        """condition NUMBER [EXPRESSION]: stop at the breakpoint only when the expression is
        true; without expression, always."""
        number, _, condition = arg.strip().partition(" ")
        if not number:
            self.error("condition needs a breakpoint number")
            return
        bp = self.session.set_condition(number, condition.strip())
        if bp.condition:
            self.say(f"Breakpoint {bp.number} stops if {bp.condition}")
        else:
            self.say(f"Breakpoint {bp.number} is now unconditional")

    def do_ignore(self, arg):
        """ignore NUMBER COUNT: pass the breakpoint COUNT times before stopping at it."""
        parts = arg.split()
        if len(parts) != 2:
            self.error("usage: ignore NUMBER COUNT")
            return
        bp = self.session.set_ignore(parts[0], _int_arg(parts[1], "count"))
        self.say(f"Breakpoint {bp.number} will be passed {bp.ignore_count} more time"
                 f"{'' if bp.ignore_count == 1 else 's'}")

    def do_breakpoints(self, arg):
        """breakpoints: list the breakpoints with their hits and ignore counts."""
        bps = sorted(self.session.breakpoints.values(), key=lambda b: b.number)
        if not bps:
            self.say("No breakpoints.")
            return
        self.say("Num  Kind  Enabled  Where")
        for bp in bps:
            kind = "once" if bp.temporary else "keep"
            self.say(f"{bp.number:<4} {kind}  {'yes' if bp.enabled else 'no ':<7}  "
                     f"{_show_path(bp.file)}:{bp.line}")
            if bp.condition:
                self.say(f"        stop only if {bp.condition}")
            if bp.hits:
                self.say(f"        hit {bp.hits} time{'' if bp.hits == 1 else 's'}")
            if bp.ignore_count:
                self.say(f"        ignore next {bp.ignore_count} hit"
                         f"{'' if bp.ignore_count == 1 else 's'}")

    # ---- exceptions ------------------------------------------------------------------------

    def do_catch(self, arg):
        """catch never|always|unhandled|user-unhandled|printed: when exceptions stop the
        program. unhandled: where nothing will catch the exception (an exception that C
        code or a `with` may still end stops in the first frame from which nothing can
        catch it). user-unhandled: also where an exception leaves the program's own code
        into library code that will catch it (the standard library, site-packages, and
        the folders given with --library), as a test runner catches a failing test.
        catch always TYPE...: always stop on these types (unless the raising function
        catches them itself). catch never TYPE...: never stop on them.
        catch: show the settings."""
        session = self.session
        words = arg.split()
        if not words:
            self.say(f"exceptions stop: {session.exception_mode()}")
            if session.exception_mode() == "user-unhandled":
                self.say("library code: " + ", ".join(map(_show_path,
                                                          session.library_paths)))
            self.say("always stop on: " + (_type_names(session.always_stop()) or "-"))
            self.say("never stop on: " + (_type_names(session.never_stop()) or "-"))
            return
        if len(words) == 1:
            session.set_exception_mode(words[0])
            self.say(f"exceptions stop: {words[0]}")
        elif words[0] == "always":
            session.set_always_stop(words[1:])
            self.say("always stop on: " + _type_names(session.always_stop()))
        elif words[0] == "never":
            session.set_never_stop(words[1:])
            self.say("never stop on: " + _type_names(session.never_stop()))
        else:
            self.error("usage: catch [never|always|unhandled|user-unhandled|printed] | "
                       "catch always|never TYPE...")

    def do_exceptions(self, arg):
        """exceptions [NUMBER]: at an exception stop, list the exception and those it was
        raised from or while handling (numbered from the oldest; `>` marks the one shown);
        with a number, show that exception's frames (where, up, down, p) from where it was
        raised. The frames an exception has left can be read, not changed."""
        session = self.session
        links, selected = session.exception_list()  # not at an exception stop: says so
        if not arg.strip():
            for number, link in enumerate(links):
                mark = ">" if number == selected else " "
                self.say(f"{mark} {number:>2} {self._link_text(link)}")
            return
        link, frame = session.select_exception(_int_arg(arg, "exceptions"))
        self._list_next = None
        self.say(f"!! {_exception_text(type(link.exc), link.exc)}")
        self.say(f"> {self._where(frame)}{self._frame_note(frame)}")
        self.say(f"-> {self._source(frame)}")

    def do_ignore_here(self, arg):
        """ignore-here: do not stop again on exceptions raised where the current one was."""
        path, line = self.session.ignore_here()
        self.say(f"exceptions at {_show_path(path)}:{line} will not stop the program again")

    def do_imports(self, arg):
        """imports: the modules loaded (or reloaded) since the last `imports`."""
        paths = self.session.take_new_imports()
        if not paths:
            self.say("no new modules")
        for path in paths:
            self.say(_show_path(path))

    # ---- threads ---------------------------------------------------------------------------

    def do_threads(self, arg):
        """threads: the program's threads; `*` marks the stopped one, `>` the one shown."""
        session = self.session
        for info in session.threads():
            mark = "*" if info.stopped else " "
            shown = ">" if info.ident == session.thread else " "
            where = self._where(info.frame) if info.frame is not None else "(running)"
            self.say(f"{shown}{mark} {info.number:<3} {info.name:<24} {where}")

    def do_thread(self, arg):
        """thread NUMBER: show that thread's frames (where, up, down, p); stepping still
        applies to the thread that stopped."""
        if not arg.strip():
            return self.do_threads("")
        info = self.session.select_thread(_int_arg(arg, "thread"))
        self._list_next = None
        self.say(f"[{info.name}] > {self._where(info.frame)}")
        self.say(f"-> {self._source(info.frame)}")


def _int_arg(text, what):
    try:
        return int(text.strip())
    except ValueError:
        raise SessionError(f"{what}: expected a number, not {text.strip()!r}") from None


def _exception_text(exc_type, value):
    name = getattr(exc_type, "__qualname__", str(exc_type))
    module = getattr(exc_type, "__module__", "builtins")
    if module not in ("builtins", "__main__"):
        name = f"{module}.{name}"
    try:
        text = str(value) if isinstance(value, BaseException) else (
            "" if value is None else str(value))
    except Exception:
        text = "<unprintable>"
    return f"{name}: {text}" if text else name


def _type_names(types):
    return ", ".join(t.__name__ for t in types)


def _dedent(doc):
    lines = doc.strip().splitlines()
    return "\n".join([lines[0]] + [line.strip() for line in lines[1:]])


def _flush_program_output():
    for stream in (sys.stdout, sys.stderr):
        try:
            stream.flush()
        except Exception:
            pass


_ALIASES = {"s": "step", "n": "next", "r": "return", "c": "continue", "cont": "continue",
            "unt": "until", "j": "jump", "q": "quit", "exit": "quit", "w": "where",
            "bt": "where", "u": "up", "d": "down", "l": "list", "ll": "longlist",
            "b": "break", "cl": "clear", "h": "help", "ignore-here": "ignore_here"}

_SUMMARY = [
    ("step (s)", "next line, into calls"),
    ("next (n)", "next line of this function"),
    ("until (unt) [LINE]", "past the current line (loops), or to LINE"),
    ("return (r)", "until this function returns"),
    ("continue (c)", "until a breakpoint or exception"),
    ("jump (j) LINE", "set the next line to run"),
    ("where (w, bt)", "the stack"),
    ("up (u) / down (d) [N]", "select another frame"),
    ("list (l) [FIRST[, LAST]]", "source around the line"),
    ("longlist (ll)", "source of the function"),
    ("p / pp EXPR", "print a value"),
    ("locals", "local variables"),
    ("!STATEMENT", "run Python (assign locals)"),
    ("break (b) [FILE:]LINE|FUNC [, COND]", "set a breakpoint"),
    ("tbreak ...", "one-time breakpoint"),
    ("clear [N...]", "delete breakpoints"),
    ("disable / enable N...", "switch breakpoints off/on"),
    ("condition N [EXPR]", "breakpoint condition"),
    ("ignore N COUNT", "pass a breakpoint COUNT times"),
    ("breakpoints", "list breakpoints and hits"),
    ("catch [MODE | always|never TYPE...]", "exception stops"),
    ("exceptions [N]", "the exception's chain; show one"),
    ("ignore-here", "stop no more at this exception's place"),
    ("threads / thread N", "list threads, show one"),
    ("imports", "modules loaded since last asked"),
    ("quit (q)", "end the debugger and the program"),
]


# ---- breakpoint() support -------------------------------------------------------------------

_started = None


def set_trace():
    """Starts a console session in a program not started under the debugger (or asks a
    running one to stop at the caller's next line)."""
    global _started
    own = _own_files()
    caller = sys._getframe(1)
    while caller is not None and caller.f_code.co_filename in own:
        caller = caller.f_back
    if _started is not None and _started.active:
        _started.stop_soon(lambda frame: frame is caller)
        return
    console = Console(Terminal.open())
    _started = Session(console)
    _started.program_started()
    _started.start(stop_at_first_line=True, first_stop=lambda frame: frame is caller)


__all__ = ["Console", "Terminal", "set_trace"]
