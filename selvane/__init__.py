"""selvane: the server side of the debugger that drives the native core.

The core is the extension module ``tvantrel30pydebugstackless``; this package holds the
Python side that initialises it, answers its callbacks and talks to the person debugging:
the debugging session (``selvane.session``), the console that shows it
(``selvane.console``) and ``python -m selvane`` (``selvane.__main__``).
"""

import builtins

# The interpreter's own import function, taken before the core's initialisation puts its
# hook into the builtins (the core must be given the original).
_ORIGINAL_IMPORT = builtins.__import__

from .catchinfo import CatchInfo, DEFAULT_PRINTING_HANDLERS  # noqa: E402

__version__ = "0.1.0"
__all__ = ["CatchInfo", "DEFAULT_PRINTING_HANDLERS", "set_trace"]


def set_trace():
    """Starts the console debugger, stopping at the line after this call (the hook of
    ``breakpoint()`` with ``PYTHONBREAKPOINT=selvane.set_trace``)."""
    from .console import set_trace as start
    start()
