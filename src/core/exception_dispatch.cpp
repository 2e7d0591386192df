// exception_dispatch.cpp: what the tracer does with exception events and with frames that
// an exception leaves, and the delivery of exceptions injected with raise_exception.
//
// The decision (stop_at_exception_no_filters) takes only the frame and the exception: it
// does not care how the event arrived, so any event source can ask it.
#include "core/exception_dispatch.h"

#include <cstring>

#include "core/dispatch.h"
#include "core/stepping.h"
#include "core/sublang.h"
#include "core/thread_policy.h"
#include "core/tracercore.h"
#include "exc/exceptops.h"
#include "exc/handlers.h"
#include "names/conames.h"
#include "support/dbgcommon.h"
#include "support/dprintf.h"
#include "support/pycompat.h"

namespace {

bool matches_list(PyObject* exc_type, const Ref& list) {
  return list && PyErr_GivenExceptionMatches(exc_type, list.get());
}

bool prints_mode() {
  return gSelf.exception_mode == 4 || gSelf.exception_mode == 5;
}

// The exception value of an event's argument (its instance on every current interpreter).
PyObject* value_of(PyObject* exc_arg) {
  return PyTuple_GET_SIZE(exc_arg) > 1 ? PyTuple_GET_ITEM(exc_arg, 1) : Py_None;
}

ThreadData* this_thread_data() {
  ThreadData* data = current_thread_data_or_insert(&gSelf.thread_table);
  if (data == nullptr) PyErr_Clear();
  return data;
}

// The traceback of an event's argument: the exception object does not always carry it yet
// when the event is reported (3.11). Borrowed; null when there is none.
PyObject* traceback_of(PyObject* exc_arg) {
  if (!PyTuple_Check(exc_arg) || PyTuple_GET_SIZE(exc_arg) < 3) return nullptr;
  PyObject* tb = PyTuple_GET_ITEM(exc_arg, 2);
  return PyTraceBack_Check(tb) ? tb : nullptr;
}

const void* code_of(PyObject* frame) {
  if (!compat::is_plain_frame(frame)) return nullptr;
  Ref code = Ref::steal(
      reinterpret_cast<PyObject*>(PyFrame_GetCode(reinterpret_cast<PyFrameObject*>(frame))));
  return code.get();  // only compared; the frame keeps its code alive
}

// Whether the thread already stopped on this exception because nothing would catch it: the
// same object, whose traceback still passes through the frame of that stop, running the
// same code. (The traceback keeps that frame alive as long as the exception lives, so a
// new exception at a reused address does not pass this test by a reused frame alone.)
bool stopped_on_before(const ThreadData* data, PyObject* exc, PyObject* traceback) {
  if (data->unhandled_stop_exc != exc || !PyExceptionInstance_Check(exc)) return false;
  Ref entry = Ref::borrow(traceback);
  for (int depth = 0; entry && PyTraceBack_Check(entry.get()) && depth < 100000; ++depth) {
    auto* tb = reinterpret_cast<PyTracebackObject*>(entry.get());
    PyObject* frame = reinterpret_cast<PyObject*>(tb->tb_frame);
    if (frame == data->unhandled_stop_frame) return code_of(frame) == data->unhandled_stop_code;
    entry = Ref::borrow(reinterpret_cast<PyObject*>(tb->tb_next));
  }
  return false;
}

// Stops once per exception: the first frame that finds it unhandled takes it.
bool first_unhandled_stop(ThreadData* data, PyObject* frame, PyObject* exc, PyObject* traceback) {
  if (data == nullptr) return true;
  if (stopped_on_before(data, exc, traceback)) {
    do_dprintf(kDbgFlow, "  already stopped on\n");
    return false;
  }
  data->unhandled_stop_exc = exc;
  data->unhandled_stop_frame = frame;
  data->unhandled_stop_code = code_of(frame);
  return true;
}

// Rule: an exception in the thread's bottom frame that nothing there can catch ends the
// program. Stop (unless an inner frame already stopped on it), and let the server side know
// it can close its connection cleanly.
bool leaves_bottom_frame(PyObject* frame, PyObject* exc, PyObject* traceback) {
  if (!compat::is_plain_frame(frame)) return false;
  ThreadData* data = this_thread_data();
  if (data == nullptr) return false;
  if (!data->bot_frame.is(frame) || frame_has_active_handler(frame)) return false;
  do_dprintf(kDbgFlow, "  leaving bottom frame\n");
  data->leaving_bot_frame = 1;
  return first_unhandled_stop(data, frame, exc, traceback);
}

// The question for the handler analysis: from `frame` outward to the thread's bottom frame
// (the frames below it are the debugger's own).
CatchPrediction predict_from(PyObject* frame, PyObject* exc, const ThreadData* data, bool leaving) {
  CatchQuestion question;
  question.leaving_frame = leaving;
  question.frame = frame;
  question.exc = exc;
  question.ignored_handlers = gSelf.ignored_exception_handlers.get();
  question.match_kind = kMatchGiven;
  if (data != nullptr && data->bot_frame && !data->bot_frame.is_none())
    question.outermost = data->bot_frame.get();
  return predict_catch(question);
}

// Rule (mode 3): the exception leaves the program's own code here, and library code will
// end it (or may: C code or a `with` of library code).
bool leaves_user_code_into_library(PyObject* frame, const CatchPrediction& prediction) {
  if (prediction.kind == CatchKind::kUncaught) return false;
  const UserCode* user_code = &gSelf.user_code;
  return !frame_is_library_code(user_code, frame) &&
         frame_is_library_code(user_code, prediction.frame.get());
}

// Rules of modes 2 and 3. Where only C code or a `with` exit may end the exception, this
// event does not stop: the exception events of the outer frames, as it reaches them, decide
// again, so that a truly unhandled one stops in the first frame nothing can catch it from.
bool stops_as_unhandled(PyObject* frame, PyObject* exc, PyObject* traceback, bool leaving) {
  enter_debugger();
  ThreadData* data = this_thread_data();
  CatchPrediction prediction = predict_from(frame, exc, data, leaving);
  if (data != nullptr && !leaving)
    data->with_may_suppress_in = prediction.kind == CatchKind::kWith ? frame : nullptr;
  bool stop = prediction.kind == CatchKind::kUncaught;
  if (!stop && gSelf.exception_mode == kExcUserUnhandledStop)
    stop = leaves_user_code_into_library(frame, prediction);
  return stop && first_unhandled_stop(data, frame, exc, traceback);
}

// Modes 2 and 3, when a frame is left by an exception that a `with` exit might have ended at
// its latest exception event: that exit let it go (no event reports a re-raise), so the
// frame, still alive, decides again before it is gone. Other frames need not: the caller's
// exception event comes next and decides. The bottom frame always does (no caller of the
// program's comes), also when other exceptions meanwhile replaced the note.
bool leaves_frame_unhandled(PyObject* frame, PyObject* exc_arg) {
  int mode = gSelf.exception_mode;
  if (mode != kExcUnhandledStop && mode != kExcUserUnhandledStop) return false;
  ThreadData* data = this_thread_data();
  if (data == nullptr || (data->with_may_suppress_in != frame && !data->bot_frame.is(frame)))
    return false;
  data->with_may_suppress_in = nullptr;
  if (!PyTuple_Check(exc_arg) || PyTuple_GET_SIZE(exc_arg) < 2) return false;
  PyObject* exc = value_of(exc_arg);
  if (!PyExceptionInstance_Check(exc) || matches_list(exc, gSelf.never_stop_excepts)) return false;
  PyObject* traceback = traceback_of(exc_arg);
  if (stopped_on_before(data, exc, traceback)) return false;
  if (!stops_as_unhandled(frame, exc, traceback, true)) return false;
  if (data->bot_frame.is(frame)) data->leaving_bot_frame = 1;
  return true;
}

// The stop made as a frame is left: the server side's questions about this frame are told
// that it is being left.
int stop_on_leaving_frame(PyObject* frame, PyObject* recorded_exc_arg) {
  Ref arg = Ref::borrow(recorded_exc_arg);  // held: the callback may drop its record
  ThreadData* data = this_thread_data();
  if (data != nullptr) data->exception_leaving_frame = frame;
  int result = do_exception_callback_if_not_filtered(frame, arg.get());
  data = this_thread_data();  // the callback may have reset the thread table
  if (data != nullptr) data->exception_leaving_frame = nullptr;
  return result;
}

// The place where the exception really happened: the innermost frame of its traceback.
Ref innermost_frame(PyObject* frame, PyObject* exc_arg) {
  if (PyTuple_GET_SIZE(exc_arg) < 3) return Ref();
  PyObject* tb = PyTuple_GET_ITEM(exc_arg, 2);
  if (tb == Py_None) return Ref::borrow(frame);
  Ref inner = Ref::steal(__find_inner_frame(tb));
  if (!inner) PyErr_Clear();
  return inner;
}

// Where the exception is reported: the file name and location object of the inner frame, or
// of the sub-language line it translates to. False when no exception may be reported here.
struct ReportedPlace {
  const char* file = nullptr;
  Ref loc;
  Ref translated;  // keeps a translated file name alive
};

bool sub_language_place(ThreadData* data, PyObject* inner, ReportedPlace& place) {
  int category = __tracer_sub_language_get_frame_category(data, inner);
  if (category == 0) return false;  // hidden implementation frames never report
  if (category != 1) return true;
  PyObject* hook = data->sub_language_hook.get();
  compat::PendingError saved;
  saved.fetch();
  Ref stop = Ref::steal(PyObject_CallMethod(hook, "_StopHere", "Oii", inner, -1, -1));
  bool wanted = stop && PyObject_IsTrue(stop.get()) > 0;
  if (wanted) {
    place.translated = Ref::steal(PyObject_CallMethod(hook, "_TranslateFrame", "Oi", inner, 1));
    PyObject* t = place.translated.get();
    if (t != nullptr && PyTuple_Check(t) && PyTuple_GET_SIZE(t) >= 2) {
      place.file = _pystring_to_c_string(PyTuple_GET_ITEM(t, 0));
      place.loc = Ref::borrow(PyTuple_GET_ITEM(t, 1));
    }
  }
  saved.restore();
  return wanted;
}

bool frame_place(PyObject* inner, ReportedPlace& place) {
  if (place.file == nullptr) {
    place.file = __tracer_get_full_path(&gSelf.co_pathname_table, inner);
    if (place.file == nullptr) PyErr_Clear();
  }
  if (!place.loc) {
    place.loc =
        Ref::steal(PyLong_FromLong(PyFrame_GetLineNumber(reinterpret_cast<PyFrameObject*>(inner))));
  }
  return place.file != nullptr && place.loc;
}

bool filtered(const ReportedPlace& place, PyObject* inner) {
  ExcFilter* found =
      __tracer_exc_filtered(&gSelf.exc_filters, gSelf.file_ops_data, place.file, place.loc.get());
  if (PyErr_Occurred() != nullptr) PyErr_Clear();  // a translated location of another shape
  if (found != nullptr) return true;
  int line = PyFrame_GetLineNumber(reinterpret_cast<PyFrameObject*>(inner));
  return __tracer_exc_filtered_hack(place.file, line) != 0;
}

// The exception being handled now, as an event argument: (type, value, traceback).
Ref handled_exception_arg() {
  Ref value = Ref::steal(PyErr_GetHandledException());
  if (!value || value.is_none())
    return Ref::steal(Py_BuildValue("(OOO)", Py_None, Py_None, Py_None));
  Ref tb = Ref::steal(PyException_GetTraceback(value.get()));
  return Ref::steal(
      Py_BuildValue("(OOO)", Py_TYPE(value.get()), value.get(), tb ? tb.get() : Py_None));
}

}  // namespace

int dispatch_exception(PyObject* frame, PyObject* exc_arg) {
  do_dprintf(kDbgFlow, "---EXCEPTION---\n");
  if (!gSelf.trace_started) return -1;
  if (!compat::is_plain_frame(frame) || !PyTuple_CheckExact(exc_arg) ||
      PyTuple_GET_SIZE(exc_arg) == 0) {
    do_dprintf(kDbgFlow, "  exit 0\n");
    return 0;
  }
  PyObject* exc_type = PyTuple_GET_ITEM(exc_arg, 0);
  if (__tracer_stop_here(frame, -1) || stop_at_exception_no_filters(frame, exc_type, exc_arg)) {
    do_dprintf(kDbgFlow, "  dispatched=TRUE\n");
    if (do_exception_callback_if_not_filtered(frame, exc_arg) != 0) {
      do_dprintf(kDbgFlow, "  failure\n");
      return -1;
    }
  }
  // Whether or not it stopped: the frame's return event needs to know the exception. (Not
  // once the callback stopped tracing: no event would come to drop the record.)
  if (gSelf.trace_started &&
      set_frame_exc_info(&gSelf.exc_data.frame_exc_info, frame, exc_arg) != 0) {
    do_dprintf(kDbgFlow, "  set_frame_exc_info failed\n");
    PyErr_Clear();
  }
  return 0;
}

int stop_at_exception_no_filters(PyObject* frame, PyObject* exc_type, PyObject* exc_arg) {
  do_dprintf(kDbgExceptions, "stop_at_exception_no_filters\n");
  TracerState& s = gSelf;
  if (s.exception_mode == kExcAlwaysStop) return 1;
  if (matches_list(exc_type, s.never_stop_excepts)) {
    do_dprintf(kDbgFlow, "  never stop\n");
    return 0;
  }
  // The instance where the event carries one (always, on current interpreters), else the type.
  PyObject* exc = value_of(exc_arg) != Py_None ? value_of(exc_arg) : exc_type;
  PyObject* traceback = traceback_of(exc_arg);
  if (leaves_bottom_frame(frame, exc, traceback)) return 1;
  PyObject* ignored = s.ignored_exception_handlers.get();
  // The handler analysis and the catch-info list may run Python code (the class expressions
  // of except clauses, the instances' attributes): the thread enters the debugger first.
  if (matches_list(exc_type, s.always_stop_excepts)) {
    enter_debugger();
    // Only an explicit clause of the raising frame itself lets an always-stop type pass.
    if (!__tracer_exc_handled(frame, ignored, exc, kMatchGivenExplicit, 1)) {
      do_dprintf(kDbgFlow, "  always stop\n");
      return 1;
    }
  }
  if (s.exception_mode == kExcUnhandledStop || s.exception_mode == kExcUserUnhandledStop) {
    if (stops_as_unhandled(frame, exc, traceback, false)) {
      do_dprintf(kDbgFlow, "  unhandled\n");
      return 1;
    }
  }
  if (prints_mode() && (enter_debugger(), frame_prints_exc(&s.exc_data, frame))) {
    do_dprintf(kDbgFlow, "  frame prints\n");
    return 1;
  }
  return 0;
}

int do_exception_callback_if_not_filtered(PyObject* frame, PyObject* exc_arg) {
  if (!PyTuple_Check(exc_arg) || PyTuple_GET_SIZE(exc_arg) == 0) return 0;
  enter_debugger();
  ThreadData* data = current_thread_data_or_insert(&gSelf.thread_table);
  if (data == nullptr) {
    PyErr_Clear();
    return 0;
  }
  Ref inner = innermost_frame(frame, exc_arg);
  if (!inner || !compat::is_plain_frame(inner.get())) return 0;
  ReportedPlace place;
  if (!sub_language_place(data, inner.get(), place)) return 0;
  if (!frame_place(inner.get(), place)) {
    PyErr_Clear();
    return 0;
  }
  if (filtered(place, inner.get())) return 0;
  int result = do_callback(gSelf.exception_cb.get(), frame, exc_arg);
  return result != 0 ? -1 : 0;
}

int dispatch_exception_return(PyObject* frame, PyObject* recorded_exc_arg) {
  if (!compat::is_plain_frame(frame)) return 0;
  int result = 0;
  if (prints_mode() && parent_frame_prints_exc(&gSelf.exc_data, frame)) {
    enter_debugger();
    // Held: the callback may drop the record it came from.
    Ref arg = recorded_exc_arg != nullptr ? Ref::borrow(recorded_exc_arg) : handled_exception_arg();
    if (!arg) return -1;
    result = do_exception_callback_if_not_filtered(frame, arg.get());
  } else if (recorded_exc_arg != nullptr && leaves_frame_unhandled(frame, recorded_exc_arg)) {
    result = stop_on_leaving_frame(frame, recorded_exc_arg);
  }
  ThreadData* data = current_thread_data_or_insert(&gSelf.thread_table);
  if (data == nullptr) {
    PyErr_Clear();
    return result;
  }
  if (data->bot_frame.is(frame)) {
    unsigned long identity = get_thread_ident();
    enter_debugger();
    data->bot_frame = Ref::none();
    call_quit_cb_if_autoquit();
    __clear_should_debug_thread_cache(identity);
  }
  return result;
}

int __tracer_set_pending_exception(ThreadData* data, PyObject* exc) {
  bool raisable = exc == Py_None || PyExceptionInstance_Check(exc) || PyExceptionClass_Check(exc);
  if (!raisable) {
    PyErr_SetString(PyExc_TypeError, "exceptions must derive from BaseException");
    return 0;
  }
  if (data->pending_exception) {
    data->pending_exception.reset();
    --gSelf.pending_exception_count;
  }
  if (exc != Py_None) {
    data->pending_exception = Ref::borrow(exc);
    ++gSelf.pending_exception_count;
  }
  return 1;
}

int __tracer_raise_pending_exception(ThreadData* data) {
  if (data == nullptr || !data->pending_exception) return 0;
  Ref exc = std::move(data->pending_exception);
  --gSelf.pending_exception_count;
  if (PyExceptionClass_Check(exc.get())) {
    PyErr_SetNone(exc.get());
  } else {
    PyErr_SetObject(reinterpret_cast<PyObject*>(Py_TYPE(exc.get())), exc.get());
  }
  return 1;
}
