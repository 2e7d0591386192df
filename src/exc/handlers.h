// handlers.h: predicting, when an exception is raised, whether an active `except` clause of
// the raising frame or of a caller will catch it, by reading the frames' byte code.
//
// There is no block stack any more: a frame's active handlers are the exception-table entries
// covering the instruction it executes (the raising instruction in the innermost frame, the
// call in progress in its callers). The innermost entry comes first; when its handler does
// not catch, the entry covering the handler's own first instruction is the next one outward.
// Only user `except` clauses, a bare `except:` and the end of an `async for` catch; `finally`
// bodies, `with` exits and the compiler's cleanup handlers neither catch nor end the search.
// Shapes that are not understood count as not catching, and so do class expressions that
// call, read a closure cell, or raise when evaluated. `except*` clauses catch when together
// they take all of the exception (every member of a group, or a plain exception).
//
// The analysis reads the de-optimised copy of the byte code (co_code), with the vocabulary of
// the running interpreter (exc/opcodes.h). It does not depend on how the exception was
// reported: it takes a frame and the exception, nothing from the event. It allocates nothing
// beyond the interpreter's own lookups, keeps the pending exception and errno, and leaves no
// error behind; lookups that fail while a class expression is evaluated are cleared and make
// that clause not match.
#pragma once

#include <Python.h>

// How a clause's class is compared with the exception.
enum HandlerMatchKind : int {
  // The interpreter's own test (subclasses match, tuples by any item); a bare `except:` catches.
  kMatchGiven = 0,
  // The same test, but a bare `except:` does not count.
  kMatchGivenExplicit = 1,
  // Identity with the exception object or its type (tuples item by item); a bare `except:`
  // does not count.
  kMatchExact = 2,
};

// Reads the interpreter's byte-code tables; called once when the module loads (more calls do
// nothing). 0 when the analysis is available; -1 when it is not, and every question below is
// then answered "not caught". Leaves no error.
int init_handler_analysis();

// 1 when `ignored_handlers` is a dict (or subclass) holding the frame's code object or the
// frame itself as a key; else 0. A failing lookup is cleared and counts as not ignored.
int frame_handlers_ignored(PyObject* frame, PyObject* ignored_handlers);

// 1 when an active handler of `frame`, or (unless this_frame_only) of a frame further out,
// catches `exc` under `match_kind`; else 0. `exc` is the exception instance (preferred: the
// identity match of kind 2 and `except*` over a group need it) or its class. Frames whose
// handlers are ignored (frame_handlers_ignored) are passed over, their callers still searched.
// Besides except clauses, an exception counts as handled where the interpreter itself ends it:
// StopIteration or IndexError reaching a running `for` loop or `yield from`/`await`, a
// StopIteration (or StopAsyncIteration) that a generator or coroutine turns into RuntimeError
// when it leaves the body, and GeneratorExit leaving a generator that close() is finishing.
int __tracer_exc_handled(PyObject* frame, PyObject* ignored_handlers, PyObject* exc,
                         int match_kind, int this_frame_only);

// 1 when the frame's current instruction is FOR_ITER or SEND and `exc` (instance or class)
// matches StopIteration or IndexError: the running loop or delegation ends with it.
int exc_stop_iter_handled(PyObject* frame, PyObject* exc);

// 1 when some exception-table entry other than the compiler's own catch-all wrappers (the
// generator and coroutine body wrapper, an inlined comprehension's restore, the throw()
// cleanup of `yield from`) covers the frame's current instruction; else 0. This is what "the
// frame has an active block" means without a block stack.
int frame_has_active_handler(PyObject* frame);

// New reference to the frame of the innermost entry of a traceback chain; None for None; null
// (no error pending) when an entry has no frame.
PyObject* __find_inner_frame(PyObject* traceback);
