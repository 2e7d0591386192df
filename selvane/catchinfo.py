"""Functions that catch exceptions and print them instead of letting them end the program.

In the "printed" exception mode the core stops where such a function catches an exception,
as if the exception were unhandled: for the person debugging it is, since all that comes of
it is a printed traceback. The core reads each instance's attributes ``co_name``,
``mod_name``, ``containing_class``, ``prints`` and ``parent``.
"""


class CatchInfo:
    """Names one function (by code name, module and containing class) that catches
    exceptions, and says whether it prints them (``prints``) and whether the printing is done
    by its caller rather than by the function itself (``parent``). ``"*"`` as the module or
    the class matches any; a module-level function matches only the class ``"*"``."""

    __slots__ = ("co_name", "mod_name", "containing_class", "prints", "parent")

    def __init__(self, co_name, mod_name="*", containing_class="*", prints=True,
                 parent=False):
        self.co_name = co_name
        self.mod_name = mod_name
        self.containing_class = containing_class
        self.prints = prints
        self.parent = parent

    def __repr__(self):
        where = self.co_name if self.containing_class == "*" else \
            f"{self.containing_class}.{self.co_name}"
        return (f"CatchInfo({self.mod_name}:{where}, prints={bool(self.prints)}, "
                f"parent={bool(self.parent)})")


# The standard library's handlers that catch whatever the code they run raises and print it.
DEFAULT_PRINTING_HANDLERS = (
    # A thread's run() that raises: the exception goes to threading.excepthook.
    CatchInfo("_bootstrap_inner", "threading", "Thread"),
    # The interactive interpreter (code.interact, the REPL of many tools).
    CatchInfo("runcode", "code", "InteractiveInterpreter"),
    # socketserver: a request handler that raises is reported by handle_error().
    CatchInfo("_handle_request_noblock", "socketserver", "BaseServer"),
    CatchInfo("process_request_thread", "socketserver", "ThreadingMixIn"),
    # asyncio: a callback that raises goes to the loop's exception handler.
    CatchInfo("_run", "asyncio.events", "Handle"),
    # logging: a handler whose emit() fails prints the error through handleError().
    CatchInfo("emit", "logging", "StreamHandler"),
    CatchInfo("emit", "logging", "FileHandler"),
    # wsgiref: the application's exception becomes a 500 answer and a printed traceback.
    CatchInfo("run", "wsgiref.handlers", "BaseHandler"),
)
