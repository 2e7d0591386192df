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

import sys  # noqa: E402

from .catchinfo import CatchInfo, DEFAULT_PRINTING_HANDLERS  # noqa: E402

__version__ = "0.1.0"
__all__ = ["CatchInfo", "DEFAULT_PRINTING_HANDLERS", "register_sub_language_hook", "set_trace"]

# What the debugger core calls on a sub-language hook.
HOOK_METHODS = ("_GetMarkerFrames", "_GetModulePaths", "_GetSubLanguageFrames", "_StopHere",
                "_TranslateFrame", "_Eval", "_GetStepOutFrame")
# The hooks the program registered, for every debugging session that runs it (a session
# initialises the core afresh, which forgets the hooks it had).
_PROGRAM_HOOKS = []


def set_trace():
    """Starts the console debugger, stopping at the line after this call (the hook of
    ``breakpoint()`` with ``PYTHONBREAKPOINT=selvane.set_trace``)."""
    from .console import set_trace as start
    start()


def register_sub_language_hook(hook):
    """Tells the debugger about a sub-language (a template language, say) implemented in
    Python: `hook` has the methods named in ``HOOK_METHODS``. A program may call this whether
    or not it runs under the debugger: without one the hook is only remembered, for a
    session started later (``set_trace()``), so the program runs the same either way. An
    object without those methods is a TypeError."""
    check_hook(hook)
    if not any(known is hook for known in _PROGRAM_HOOKS):
        _PROGRAM_HOOKS.append(hook)
    session = sys.modules.get(__name__ + ".session")
    if session is not None:  # the debugger may be running: the hook goes to it at once
        session._register_from_program(hook)


def check_hook(hook):
    """Raises TypeError unless `hook` has every method of a sub-language hook."""
    missing = []
    for name in HOOK_METHODS:
        try:
            method = getattr(hook, name)
        except Exception:  # a property that raises counts as missing
            method = None
        if not callable(method):
            missing.append(name)
    if missing:
        raise TypeError(f"{_short(hook)} is not a sub-language hook: it has no "
                        + ", ".join(missing))


def _short(value):
    try:
        text = repr(value)
    except Exception:
        text = f"<{type(value).__name__} object>"
    return text if len(text) <= 80 else text[:77] + "..."
