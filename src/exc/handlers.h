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

#include "support/ref.h"

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

// What will become of an exception, seen from the frame where it is now.
enum class CatchKind : int {
  kUncaught = 0,  // nothing catches it
  kCaught,        // an except clause (or the interpreter, ending a loop) of `frame` catches it
  kCCode,         // C code called from `frame` may end it: we cannot read what C code does
  kWith,          // the exit of a `with` block running in `frame` may suppress it
};

struct CatchPrediction {
  CatchKind kind = CatchKind::kUncaught;
  Ref frame;        // the frame that catches, that called into C, or that runs the `with`
  int offset = -1;  // byte offset in that frame's code of the handler or `with` exit; -1:
                    // the frame's current instruction (the call, the loop)
};

struct CatchQuestion {
  PyObject* frame = nullptr;             // borrowed: where the exception is now
  PyObject* exc = nullptr;               // borrowed: the instance (preferred) or its class
  PyObject* ignored_handlers = nullptr;  // borrowed or null: frames whose handlers are passed over
  int match_kind = kMatchGiven;
  bool this_frame_only = false;
  PyObject* outermost = nullptr;  // borrowed or null: the walk ends after this frame
  // The exception is leaving `frame`: its handlers already had their turn (and its value
  // stack is gone; the instruction it reports may be the original raise again).
  bool leaving_frame = false;
};

// Walks from the frame outward and answers with the first place that surely catches the
// exception; when none does, with the innermost place that may (a `with` exit that is not
// readable, or C code between two Python frames: a frame entered from C that is not a
// generator resumed by its caller's loop); else uncaught. Within a frame, handlers are read
// as described at the top. Exact `with` exits: contextlib.suppress by its types, and a
// @contextmanager generator by the handlers around its suspended yield. Besides handlers,
// the interpreter itself ends a StopIteration at the FOR_ITER or SEND the first frame stands
// on, and StopIteration, StopAsyncIteration and GeneratorExit where a generator body is left.
// Never runs code of the program except the class expressions of except clauses; keeps the
// pending exception and leaves no error.
CatchPrediction predict_catch(const CatchQuestion& question);

// The line a prediction names: of its handler or `with`, or the frame's current line; 0
// without a frame.
int catch_prediction_line(const CatchPrediction& prediction);

// 1 when predict_catch answers kCaught for these arguments (the walk goes to the last frame).
int __tracer_exc_handled(PyObject* frame, PyObject* ignored_handlers, PyObject* exc, int match_kind,
                         int this_frame_only);

// 1 when the frame's current instruction is FOR_ITER or SEND and `exc` (instance or class)
// matches StopIteration: the running loop or delegation ends with it.
int exc_stop_iter_handled(PyObject* frame, PyObject* exc);

// 1 when some exception-table entry other than the compiler's own catch-all wrappers (the
// generator and coroutine body wrapper, an inlined comprehension's restore, the throw()
// cleanup of `yield from`) covers the frame's current instruction; else 0. This is what "the
// frame has an active block" means without a block stack.
int frame_has_active_handler(PyObject* frame);

// 1 when the frame stands at the first instruction of an exception handler (PUSH_EXC_INFO):
// the exception it just raised or received is about to be handled there, although the
// interpreter does not show it as handled yet. Else 0; leaves no error.
int frame_entering_handler(PyObject* frame);

// New reference to the frame of the innermost entry of a traceback chain; None for None; null
// (no error pending) when an entry has no frame.
PyObject* __find_inner_frame(PyObject* traceback);
