// monitoring.cpp: sys.monitoring as the source of events (see monitoring.h).
//
// The callbacks are builtin functions of our own (vectorcall, no Python frame of their own):
// the frame of an event is the interpreter's current frame while the callback runs. They map
// the event and hand it to the same dispatcher as the trace function. A callback that returns
// an error makes the interpreter raise it at the event's place in the program, which is how
// an exception injected with raise_exception reaches the program here too.
//
// Whatever a callback returns, it is never DISABLE from an exception event: up to 3.14 that
// raises in the program and unregisters the callback for the whole process.
#include "core/monitoring.h"

#include <cstdlib>
#include <cstring>

#include "bp/bpops.h"
#include "core/dispatch.h"
#include "core/tracercore.h"
#include "exc/exceptops.h"
#include "support/dbgcommon.h"
#include "support/dprintf.h"
#include "support/pycompat.h"
#include "threads/threadops.h"
#include "support/ref.h"

namespace {

constexpr const char* kToolName = "selvane";

constexpr size_t kCallbackCount = 11;  // the events of gCallbacks below

struct MonitoringTool {
  Ref monitoring;                  // sys.monitoring while the tool is in use
  Ref tool_id;                     // int: sys.monitoring.DEBUGGER_ID
  Ref disable;                     // sys.monitoring.DISABLE
  Ref event_bits[kCallbackCount];  // int per callback, read from sys.monitoring.events
  bool in_use = false;
  bool quiet = false;  // some place answered DISABLE since the last restart
};

// Never destroyed: the interpreter is gone by the time static objects are, and the tool's
// references must not be released then.
NoDestructor<MonitoringTool> gToolStorage;
MonitoringTool& gTool = gToolStorage.get();

// ---- Mapping the events ---------------------------------------------------------------------

// Hands one mapped event to the dispatcher; None, or null with the error to raise.
PyObject* deliver(int what, PyObject* arg) {
  PyFrameObject* frame = PyEval_GetFrame();  // borrowed: the event's frame
  if (frame == nullptr) Py_RETURN_NONE;
  if (dispatch_monitoring_event(frame, what, arg) != 0 && PyErr_Occurred() != nullptr) {
    return nullptr;
  }
  Py_RETURN_NONE;
}

// A line event whose line LINE reported (or -1): the hit test reads it instead of working it
// out from the frame again.
PyObject* deliver_line(long line) {
  PyFrameObject* frame = PyEval_GetFrame();  // borrowed: the event's frame
  if (frame == nullptr || line < 0 || line > INT32_MAX) return deliver(PyTrace_LINE, nullptr);
  LineHint hint(&gSelf.bp_ops_data, reinterpret_cast<PyObject*>(frame), static_cast<int>(line));
  return deliver(PyTrace_LINE, nullptr);
}

// PY_THROW: a call event whose place must never answer DISABLE (see the head of the file).
PyObject* on_throw(PyObject*, PyObject* const*, Py_ssize_t) {
  return deliver(PyTrace_CALL, nullptr);
}

// ---- Exception records ------------------------------------------------------------------------
//
// A frame's record lives while its exception is in flight there (exceptops.h): RAISE makes
// it, and each of the events below ends it, so none outlives what the interpreter keeps.

// The trace function's exception argument: (type, value, traceback); null with no error when
// there is no memory for it.
Ref exception_arg(PyObject* exc) {
  PyObject* tb = PyException_GetTraceback(exc);  // new reference or null
  Ref traceback = tb != nullptr ? Ref::steal(tb) : Ref::none();
  Ref arg =
      Ref::steal(PyTuple_Pack(3, reinterpret_cast<PyObject*>(Py_TYPE(exc)), exc, traceback.get()));
  if (!arg) PyErr_Clear();
  return arg;
}

void forget_record_of(PyFrameObject* frame) {
  if (frame == nullptr || !gSelf.exc_data.frame_exc_info) return;
  forget_frame_exc_info(&gSelf.exc_data.frame_exc_info, reinterpret_cast<PyObject*>(frame));
}

// A handler of the frame took the exception. Should it raise again, PY_UNWIND names it.
PyObject* on_exception_handled(PyObject*, PyObject* const*, Py_ssize_t) {
  forget_record_of(PyEval_GetFrame());
  Py_RETURN_NONE;
}

// Left by an exception. The event names it: it becomes the frame's record for the return
// dispatch (a handler that raised again had dropped the first), and goes with the frame.
PyObject* on_unwind(PyObject*, PyObject* const* args, Py_ssize_t nargs) {
  PyFrameObject* frame = PyEval_GetFrame();
  if (frame != nullptr && nargs > 2 && PyExceptionInstance_Check(args[2])) {
    Ref arg = exception_arg(args[2]);
    if (arg && set_frame_exc_info(&gSelf.exc_data.frame_exc_info,
                                  reinterpret_cast<PyObject*>(frame), arg.get()) != 0) {
      PyErr_Clear();
    }
  }
  PyObject* answer = deliver(PyTrace_RETURN, nullptr);  // left by an exception: no value
  forget_record_of(frame);
  return answer;
}

// ---- Quiet places -----------------------------------------------------------------------------

bool is_frame_of(const Ref& frame, PyCodeObject* code) {
  if (!frame || !compat::is_plain_frame(frame.get())) return false;
  PyCodeObject* frame_code = PyFrame_GetCode(reinterpret_cast<PyFrameObject*>(frame.get()));
  Py_DECREF(frame_code);
  return frame_code == code;
}

// Whether no thread's stepping can stop in `code`. A thread that runs freely cannot; one that
// stops at the next event anywhere (step into, stop) or steps over a line range (it stops in
// any frame once the stop frame has left) can stop anywhere; one that steps over a frame or
// out of one stops only in the stop frame's code and at the step-out frame's return (both
// frames' returns stay reported, and an exception leaving them always is).
bool threads_leave_code_alone(PyCodeObject* code) {
  if (gSelf.pending_exception_count != 0) return false;  // raised at the next event
  CU_HashSearch search;
  for (CU_HashEntry* entry = CU_FirstHashEntry(&gSelf.thread_table, &search); entry != nullptr;
       entry = CU_NextHashEntry(&search)) {
    auto* data = static_cast<ThreadData*>(CU_GetHashValue(entry));
    if (data == nullptr) continue;
    if (data->stop_frame && (data->stop_frame.is_none() || data->line_range_start != -1 ||
                             is_frame_of(data->stop_frame, code))) {
      return false;
    }
    if (is_frame_of(data->step_out_frame, code)) return false;
  }
  return true;
}

// Nothing can stop in `code` but a breakpoint: no thread's stepping, no sub-language deciding
// at its frames. (The idle callback runs at most once a second, on the events that still
// come; a server side that wants a thread to stop gives it a command, which brings every
// place back.)
bool run_freely_in(PyCodeObject* code) {
  return !gSelf.sub_language.enabled && gSelf.trace_started && threads_leave_code_alone(code);
}

bool has_breakpoint_line(long line) {
  return __tracer_bps_at_line(&gSelf.bp_ops_data, static_cast<int32_t>(line)) != nullptr;
}

bool line_may_go_quiet(PyCodeObject* code, long line) {
  return !has_breakpoint_line(line) && run_freely_in(code);
}

PyCodeObject* function_code(PyFrameObject* frame) {  // new reference, or null
  PyCodeObject* code = PyFrame_GetCode(frame);
  if ((code->co_flags & CO_OPTIMIZED) != 0) return code;
  Py_DECREF(code);  // module and class bodies: their calls register modules, and run once
  return nullptr;
}

bool is_bot_frame_code_of_a_thread(PyCodeObject* code) {
  CU_HashSearch search;
  for (CU_HashEntry* entry = CU_FirstHashEntry(&gSelf.thread_table, &search); entry != nullptr;
       entry = CU_NextHashEntry(&search)) {
    auto* data = static_cast<ThreadData*>(CU_GetHashValue(entry));
    if (data == nullptr || !data->bot_frame || data->bot_frame.is_none()) continue;
    PyCodeObject* bot_code =
        PyFrame_GetCode(reinterpret_cast<PyFrameObject*>(data->bot_frame.get()));
    Py_DECREF(bot_code);
    if (bot_code == code) return true;
  }
  return false;
}

// A function's call events tell the running core nothing once its thread has a bottom frame.
// (From 3.13 on a function written on its header line loses its first LINE where PY_START is
// quiet: not while that line has a breakpoint.)
bool call_may_go_quiet(PyFrameObject* frame) {
  PyCodeObject* code = function_code(frame);
  if (code == nullptr) return false;
  bool quiet = !has_breakpoint_line(code->co_firstlineno) && run_freely_in(code);
  Py_DECREF(code);
  if (!quiet) return false;
  ThreadData* data = find_thread_data(&gSelf.thread_table, PyThreadState_Get());
  return data != nullptr && data->bot_frame && !data->bot_frame.is_none();
}

// A function's returns tell the running core nothing unless it is some thread's bottom frame
// (autoquit, the thread policy) or holds an exception record to forget.
bool return_may_go_quiet(PyFrameObject* frame) {
  PyCodeObject* code = function_code(frame);
  if (code == nullptr) return false;
  bool quiet = run_freely_in(code) && !is_bot_frame_code_of_a_thread(code);
  Py_DECREF(code);
  return quiet && (!gSelf.exc_data.frame_exc_info ||
                   find_frame_exc_info(&gSelf.exc_data.frame_exc_info,
                                       reinterpret_cast<PyObject*>(frame)) == nullptr);
}

// DISABLE for a place that answered None and may go quiet.
PyObject* quiet_answer(PyObject* answer, bool (*may_go_quiet)(PyFrameObject*)) {
  if (answer != Py_None || !gTool.disable) return answer;
  PyFrameObject* frame = PyEval_GetFrame();
  if (frame == nullptr || !may_go_quiet(frame)) return answer;
  Py_DECREF(answer);
  gTool.quiet = true;
  return gTool.disable.new_ref();
}

PyObject* on_call(PyObject*, PyObject* const*, Py_ssize_t) {
  return quiet_answer(deliver(PyTrace_CALL, nullptr), call_may_go_quiet);
}

PyObject* on_return(PyObject*, PyObject* const* args, Py_ssize_t nargs) {
  return quiet_answer(deliver(PyTrace_RETURN, nargs > 2 ? args[2] : Py_None), return_may_go_quiet);
}

// The answer to a line event that went through the dispatcher: DISABLE where the place may go
// quiet, else what the dispatcher answered.
PyObject* quiet_if_possible(PyObject* answer, PyObject* code, long line) {
  if (answer != Py_None || !gTool.disable || !PyCode_Check(code) ||
      !line_may_go_quiet(reinterpret_cast<PyCodeObject*>(code), line)) {
    return answer;
  }
  Py_DECREF(answer);
  gTool.quiet = true;
  return gTool.disable.new_ref();
}

PyObject* on_line(PyObject*, PyObject* const* args, Py_ssize_t nargs) {
  long line = nargs >= 2 ? PyLong_AsLong(args[1]) : -1;
  if (line == -1 && PyErr_Occurred() != nullptr) PyErr_Clear();
  PyObject* answer = deliver_line(line);
  if (answer == nullptr || line < 0) return answer;
  return quiet_if_possible(answer, args[0], line);
}

int line_of(PyObject* code, PyObject* offset) {
  long at = PyLong_AsLong(offset);
  if (at == -1 && PyErr_Occurred() != nullptr) {
    PyErr_Clear();
    return -1;
  }
  return PyCode_Addr2Line(reinterpret_cast<PyCodeObject*>(code), static_cast<int>(at));
}

// A jump back to an earlier instruction of the same line starts the line again: the trace
// function reports it as a line event, LINE does not.
PyObject* on_jump(PyObject*, PyObject* const* args, Py_ssize_t nargs) {
  if (nargs < 3 || !PyCode_Check(args[0])) Py_RETURN_NONE;
  int cmp = PyObject_RichCompareBool(args[2], args[1], Py_LT);
  if (cmp < 0) PyErr_Clear();
  int from = cmp > 0 ? line_of(args[0], args[1]) : -1;
  if (from < 0 || from != line_of(args[0], args[2])) {
    // This jump is never a line's new start: its place has nothing to tell, ever.
    if (!gTool.disable) Py_RETURN_NONE;
    gTool.quiet = true;
    return gTool.disable.new_ref();
  }
  return quiet_if_possible(deliver(PyTrace_LINE, nullptr), args[0], from);
}

PyObject* deliver_exception(PyObject* exc) {
  Ref arg = exception_arg(exc);
  if (!arg) Py_RETURN_NONE;  // without memory for the tuple this event goes unseen
  return deliver(PyTrace_EXCEPTION, arg.get());
}

PyObject* on_raise(PyObject*, PyObject* const* args, Py_ssize_t nargs) {
  if (nargs < 3 || !PyExceptionInstance_Check(args[2])) Py_RETURN_NONE;
  return deliver_exception(args[2]);
}

// A generator or coroutine that returns inside `yield from`/`await` ends its callee with a
// StopIteration that is never raised as an object: the event carries the instance on some
// versions and the value on others. The trace function reports a StopIteration.
PyObject* on_stop_iteration(PyObject*, PyObject* const* args, Py_ssize_t nargs) {
  if (nargs < 3) Py_RETURN_NONE;
  PyObject* answer = nullptr;
  if (PyObject_TypeCheck(args[2], reinterpret_cast<PyTypeObject*>(PyExc_StopIteration))) {
    answer = deliver_exception(args[2]);
  } else {
    Ref exc = Ref::steal(PyObject_CallOneArg(PyExc_StopIteration, args[2]));
    if (!exc) {
      PyErr_Clear();
      Py_RETURN_NONE;
    }
    answer = deliver_exception(exc.get());
  }
  // The loop or the delegation consumes it on the spot: it never leaves the frame, and no
  // handler event follows.
  forget_record_of(PyEval_GetFrame());
  return answer;
}

// ---- The tool ---------------------------------------------------------------------------------

struct EventCallback {
  const char* event;  // name in sys.monitoring.events
  PyMethodDef method;
};

#define CALLBACK(event, fn)                                                              \
  {                                                                                      \
    event, {                                                                             \
      "selvane_" event, reinterpret_cast<PyCFunction>(reinterpret_cast<void (*)()>(fn)), \
          METH_FASTCALL, nullptr                                                         \
    }                                                                                    \
  }

EventCallback gCallbacks[] = {
    CALLBACK("PY_START", on_call),
    CALLBACK("PY_RESUME", on_call),
    CALLBACK("PY_THROW", on_throw),
    CALLBACK("PY_RETURN", on_return),
    CALLBACK("PY_YIELD", on_return),
    CALLBACK("PY_UNWIND", on_unwind),
    CALLBACK("LINE", on_line),
    CALLBACK("JUMP", on_jump),
    CALLBACK("RAISE", on_raise),
    CALLBACK("STOP_ITERATION", on_stop_iteration),
    CALLBACK("EXCEPTION_HANDLED", on_exception_handled),
};

#undef CALLBACK

static_assert(sizeof(gCallbacks) / sizeof(gCallbacks[0]) == kCallbackCount);

Ref monitoring_module() {
  Ref sys = Ref::steal(PyImport_ImportModule("sys"));
  if (!sys) return Ref();
  Ref monitoring = Ref::steal(PyObject_GetAttrString(sys.get(), "monitoring"));
  if (!monitoring) {
    PyErr_Clear();
    PyErr_SetString(PyExc_RuntimeError,
                    "sys.monitoring is not available in this interpreter (Python 3.12 or later "
                    "has it)");
  }
  return monitoring;
}

// Refuses an id that another tool holds, naming it. 0 when the id is free.
int check_tool_id_free(PyObject* monitoring, PyObject* tool_id) {
  Ref holder = Ref::steal(PyObject_CallMethod(monitoring, "get_tool", "O", tool_id));
  if (!holder) return -1;
  if (holder.is_none()) return 0;
  Ref name = Ref::steal(PyObject_Repr(holder.get()));
  PyErr_Format(PyExc_RuntimeError,
               "sys.monitoring tool id %S (the debugger's) is already in use by %s: another "
               "debugger holds it; set SELVANE_EVENT_SOURCE=settrace to debug with the trace "
               "function instead",
               tool_id, name ? PyUnicode_AsUTF8(name.get()) : "another tool");
  return -1;
}

bool read_event_bits(PyObject* monitoring) {
  Ref events = Ref::steal(PyObject_GetAttrString(monitoring, "events"));
  if (!events) return false;
  for (size_t i = 0; i < kCallbackCount; ++i) {
    gTool.event_bits[i] = Ref::steal(PyObject_GetAttrString(events.get(), gCallbacks[i].event));
    if (!gTool.event_bits[i]) return false;
  }
  return true;
}

// Registers every callback (or, with `on` false, unregisters them) and sums the events.
bool register_callbacks(bool on, long* mask) {
  *mask = 0;
  for (size_t i = 0; i < kCallbackCount; ++i) {
    Ref callback = on ? Ref::steal(PyCFunction_New(&gCallbacks[i].method, nullptr)) : Ref::none();
    if (!callback) return false;
    Ref previous = Ref::steal(PyObject_CallMethod(gTool.monitoring.get(), "register_callback",
                                                  "OOO", gTool.tool_id.get(),
                                                  gTool.event_bits[i].get(), callback.get()));
    if (!previous) return false;
    *mask |= PyLong_AsLong(gTool.event_bits[i].get());
  }
  return PyErr_Occurred() == nullptr;
}

bool set_events(long mask) {
  Ref done = Ref::steal(
      PyObject_CallMethod(gTool.monitoring.get(), "set_events", "Ol", gTool.tool_id.get(), mask));
  return static_cast<bool>(done);
}

void log_and_clear() {
  if (PyErr_Occurred() == nullptr) return;
  DLOGEXCEPTION();
  PyErr_Clear();
}

}  // namespace

bool monitoring_available() {
  Ref sys = Ref::steal(PyImport_ImportModule("sys"));
  if (!sys) {
    PyErr_Clear();
    return false;
  }
  int has = PyObject_HasAttrString(sys.get(), "monitoring");
  return has == 1;
}

int read_event_source_setting(int* source) {
  const char* value = std::getenv("SELVANE_EVENT_SOURCE");
  if (value == nullptr || value[0] == '\0') {
    // sys.monitoring where the interpreter has it: a program then runs at its untraced speed
    // wherever it cannot stop.
    *source = monitoring_available() ? kEventsFromMonitoring : kEventsFromTrace;
    return 0;
  }
  if (std::strcmp(value, "settrace") == 0) {
    *source = kEventsFromTrace;
    return 0;
  }
  if (std::strcmp(value, "monitoring") != 0) {
    PyErr_Format(PyExc_ValueError,
                 "SELVANE_EVENT_SOURCE must be 'settrace' or 'monitoring', not '%s'", value);
    return -1;
  }
  if (!monitoring_module()) return -1;
  *source = kEventsFromMonitoring;
  return 0;
}

int monitoring_start() {
  if (gTool.in_use) return 0;
  Ref monitoring = monitoring_module();
  if (!monitoring) return -1;
  Ref tool_id = Ref::steal(PyObject_GetAttrString(monitoring.get(), "DEBUGGER_ID"));
  if (!tool_id || check_tool_id_free(monitoring.get(), tool_id.get()) != 0) return -1;
  gTool.monitoring = monitoring;
  gTool.tool_id = tool_id;
  gTool.disable = Ref::steal(PyObject_GetAttrString(monitoring.get(), "DISABLE"));
  if (!gTool.disable || !read_event_bits(monitoring.get())) return -1;
  Ref used = Ref::steal(
      PyObject_CallMethod(monitoring.get(), "use_tool_id", "Os", tool_id.get(), kToolName));
  if (!used) return -1;
  gTool.in_use = true;
  long mask = 0;
  if (!register_callbacks(true, &mask) || !set_events(mask)) {
    compat::PendingError failure;
    failure.fetch();
    monitoring_stop();
    failure.restore();
    return -1;
  }
  // Places made quiet in an earlier session stay quiet for the id, whoever takes it next.
  gTool.quiet = true;
  monitoring_lines_needed();
  do_dprintf(kDbgFlow, "sys.monitoring: events 0x%lx as tool %s\n", mask, kToolName);
  return 0;
}

void monitoring_lines_needed() {
  if (!gTool.in_use || !gTool.quiet) return;
  gTool.quiet = false;
  compat::PendingError saved;
  saved.fetch();
  Ref done = Ref::steal(PyObject_CallMethod(gTool.monitoring.get(), "restart_events", nullptr));
  if (!done) log_and_clear();
  saved.restore();
}

void monitoring_stop() {
  if (!gTool.in_use) return;
  gTool.in_use = false;
  // Up to 3.13 freeing the id leaves its events and callbacks in force: all go first.
  if (!set_events(0)) log_and_clear();
  long mask = 0;
  if (!register_callbacks(false, &mask)) log_and_clear();
  Ref freed = Ref::steal(
      PyObject_CallMethod(gTool.monitoring.get(), "free_tool_id", "O", gTool.tool_id.get()));
  if (!freed) log_and_clear();
  do_dprintf(kDbgFlow, "sys.monitoring: tool %s stopped\n", kToolName);
}
