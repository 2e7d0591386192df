"""The debugger's hook for templang: it tells the debugger core that a call of `render` enters
a template, that each call of `_execute` is one template line (a key frame), and that every
other frame of this package is implementation to hide; it translates key frames into the
template's file and line and evaluates breakpoint conditions in the template's variables.

Register it with the debugger before the templates run: `python -m selvane --sub-language
templang.debughook:TemplateHook prog.py`, or `selvane.register_sub_language_hook(
TemplateHook())` from the program. The core calls these methods from inside its trace
function; apart from `_Eval` (whose errors make a broken condition stop, as for Python
breakpoints) none of them raises for a frame it was meant to see.
"""

import builtins
import os

from . import engine

# The events and actions the core passes to _StopHere.
CALL, LINE, RETURN, EXCEPTION = 0, 1, 2, -1
STEP_INTO, STEP_OVER, STEP_OUT = 0, 1, 2  # -1: running freely


class TemplateHook:
    def __init__(self):
        self._render = engine.render.__code__
        self._execute = engine._execute.__code__
        package = os.path.dirname(os.path.abspath(engine.__file__))
        prefixes = {package + os.sep, os.path.realpath(package) + os.sep}
        self._module_paths = [(prefix, 1) for prefix in sorted(prefixes)]
        self._paths = {}  # template path as the engine holds it -> its absolute form

    # ---- what the core loads once --------------------------------------------------------

    def _GetMarkerFrames(self):
        return [self._render]

    def _GetModulePaths(self):
        return list(self._module_paths)

    def _GetSubLanguageFrames(self):
        return [self._execute]

    # ---- per event -------------------------------------------------------------------------

    def _StopHere(self, frame, event, action):
        """One stop per template line: at the call of `_execute` (entering the line) when
        stepping into or over template lines, and when the core asks on behalf of a
        breakpoint (action 1); at an exception the line raised unless a step-out is under
        way. The line and return events inside `_execute` are the engine's own work."""
        if event == CALL:
            return action in (STEP_INTO, STEP_OVER)
        if event == EXCEPTION:
            return action != STEP_OUT
        return False

    def _TranslateFrame(self, frame, kind):
        """(template file, template line) of a key frame; the file is absolute, as the
        debugger sets template breakpoints, or "<string>" for a template given as text."""
        line = self._line(frame)
        path = line.template.path
        absolute = self._paths.get(path)
        if absolute is None:
            absolute = path if path.startswith("<") else os.path.abspath(path)
            self._paths[path] = absolute
        return (absolute, line.number)

    def _Eval(self, condition, frame):
        """A breakpoint condition, in Python syntax, evaluated in the template's variables
        (a copy: a condition cannot change what the template sees)."""
        variables = dict(self._context(frame))
        return eval(condition, {"__builtins__": builtins}, variables)

    def _GetStepOutFrame(self, frame):
        """Out of a template line: the frame that called `render`. Out of anything else (a
        Python function the template called): its caller, as for Python code."""
        if frame.f_code is not self._execute:
            return frame.f_back
        marker = frame.f_back
        while marker is not None and marker.f_code is not self._render:
            marker = marker.f_back
        return marker.f_back if marker is not None else None

    # ---- beyond the core's protocol: what selvane shows with `locals` ---------------------

    def variables(self, frame):
        """The template's variables at a key frame (a copy)."""
        return dict(self._context(frame))

    # ---- helpers -------------------------------------------------------------------------

    def _line(self, frame):
        if frame.f_code is not self._execute:
            raise ValueError(f"not a template line: {frame.f_code.co_name}()")
        return frame.f_locals["line"]

    def _context(self, frame):
        self._line(frame)
        return frame.f_locals["ctx"]
