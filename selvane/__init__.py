"""selvane: the server side of the debugger that drives the native core.

The core is the extension module ``tvantrel30pydebugstackless``; this package holds the
Python side that initialises it, answers its callbacks and talks to the person debugging.
"""

__version__ = "0.1.0"
