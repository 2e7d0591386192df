"""Runs the debugged program as the interpreter would run it untraced: as `__main__`, with
the `sys.argv`, `sys.path[0]` and working directory that `python script.py` or
`python -m module` gives it, and with the exit status and the printed traceback it would end
with. The frames of this module stay out of the person's view (they are the debugger's own)
and their handlers do not count as catching the program's exceptions.
"""

import builtins
import importlib.machinery
import io
import os
import runpy
import sys
import threading
import types


def _main_extras(cached):
    """The names of the interpreter's own __main__ that come and go with the version: an
    empty __annotations__ before 3.14 (annotations are made lazily since), __cached__
    before 3.15."""
    extras = {}
    if sys.version_info < (3, 14):
        extras["__annotations__"] = {}
    if sys.version_info < (3, 15):
        extras["__cached__"] = cached
    return extras


class ProgramError(Exception):
    """The program cannot be started (no such file or module, a syntax error); the text is
    what the interpreter would have said."""

    def __init__(self, text, status):
        super().__init__(text)
        self.status = status


class Program:
    """A script or a module to run, with its arguments."""

    def __init__(self, target, args, is_module=False):
        self.target = target
        self.args = list(args)
        self.is_module = is_module
        self.file = None
        self.code = None
        self.globals = None
        self.path0 = None

    def prepare(self):
        """Finds and compiles the program; raises ProgramError when it cannot run."""
        if self.is_module:
            self._prepare_module()
        else:
            self._prepare_script()

    def _prepare_script(self):
        path = os.path.abspath(self.target)
        try:
            with io.open_code(path) as f:
                source = f.read()
        except OSError as error:
            raise ProgramError(f"can't open file {path!r}: [Errno {error.errno}] "
                               f"{error.strerror}", 2) from None
        self.code = _compile(source, path)
        self.file = path
        self.path0 = os.path.dirname(os.path.realpath(path))
        self.argv0 = self.target
        self.globals = {"__name__": "__main__", "__doc__": None, "__package__": None,
                        "__loader__": importlib.machinery.SourceFileLoader("__main__", path),
                        "__spec__": None, "__file__": path,
                        **_main_extras(None)}

    def _prepare_module(self):
        # As `python -m`: the current directory comes first on the path while the module is
        # looked up and while it runs.
        self.path0 = os.getcwd()
        sys.path.insert(0, self.path0)
        try:
            name, module_found, code = runpy._get_module_details(self.target)
        except ImportError as error:
            raise ProgramError(f"{error}", 1) from None
        except SyntaxError as error:
            raise ProgramError(_syntax_text(error), 1) from None
        finally:
            sys.path.pop(0)
        self.code = code
        self.file = module_found.origin
        self.argv0 = module_found.origin
        self.globals = {"__name__": "__main__", "__doc__": None,
                        "__package__": module_found.parent,
                        "__loader__": module_found.loader, "__spec__": module_found,
                        "__file__": module_found.origin,
                        **_main_extras(module_found.cached)}

    def install(self):
        """Makes the program's view of the interpreter: __main__, sys.argv, sys.path[0]."""
        module = types.ModuleType("__main__")
        module.__dict__.update(self.globals)
        module.__builtins__ = builtins  # the module, as in the interpreter's own __main__
        self.globals = module.__dict__
        sys.modules["__main__"] = module
        sys.argv = [self.argv0] + self.args
        if sys.path:
            sys.path[0] = self.path0  # where `python -m selvane` put its own directory
        else:
            sys.path.insert(0, self.path0)
        return module


def _compile(source, path):
    try:
        return compile(source, path, "exec", dont_inherit=True)
    except SyntaxError as error:
        raise ProgramError(_syntax_text(error), 1) from None
    except ValueError as error:  # null bytes
        raise ProgramError(f"SyntaxError: {error}", 1) from None


def _syntax_text(error):
    import traceback
    return "".join(traceback.format_exception_only(type(error), error)).rstrip()


def run(session, program, on_start):
    """Runs the prepared program under the session; answers its exit status. `on_start` is
    called just before the program's first line (when tracing is already on)."""
    program.install()
    session.ignore_handlers_of(run.__code__, _execute.__code__)
    status = _execute(session, program, on_start)
    _wait_for_threads()
    return status


def _execute(session, program, on_start):
    code, globals_ = program.code, program.globals
    try:
        on_start()
        exec(code, globals_)
    except SystemExit as leaving:
        return _exit_status(leaving.code)
    except BaseException as error:
        # As the interpreter: the hook prints the traceback (without this frame) and the
        # status is 1.
        tb = error.__traceback__.tb_next if error.__traceback__ is not None else None
        error.__traceback__ = tb  # newer hooks read the traceback from the exception
        try:
            sys.excepthook(type(error), error, tb)
        except BaseException:
            pass
        return 1
    return 0


def _exit_status(code):
    if code is None:
        return 0
    if isinstance(code, int):
        return code & 0xFF if code >= 0 else code & 0xFF
    try:
        sys.stderr.write(f"{code}\n")
    except Exception:
        pass
    return 1


def _wait_for_threads():
    """As the interpreter does at the end of the main program: wait for the threads that are
    not daemons."""
    main = threading.main_thread()
    while True:
        waiting = [t for t in threading.enumerate()
                   if t is not main and not t.daemon and t.is_alive()]
        if not waiting:
            return
        for thread in waiting:
            thread.join()
