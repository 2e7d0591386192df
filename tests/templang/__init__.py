"""templang: a small template language of the tests, implemented in Python, and the hook
that lets the debugger step through its templates (`templang.debughook`)."""

from .engine import TemplateSyntaxError, render

__all__ = ["render", "TemplateSyntaxError"]
