// install.cpp: switching tracing on and off for the calling thread, for the frames of every
// thread of the interpreter and for threads started later; start_trace and stop_trace.
#include "core/install.h"

#include <cstring>
#include <vector>

#include "core/dispatch.h"
#include "core/idleticker.h"
#include "core/imports.h"
#include "core/monitoring.h"
#include "core/tracercore.h"
#include "support/dbgcommon.h"
#include "support/dprintf.h"
#include "support/pycompat.h"
#include "threads/threadops.h"

namespace {

Ref get_f_trace(PyObject* frame) {
  Ref value = compat::frame_get_trace(frame);
  if (!value) PyErr_Clear();
  return value;
}

void set_f_trace(PyObject* frame, PyObject* value) {
  if (compat::frame_set_trace(frame, value) != 0) {
    DLOGEXCEPTION();
    PyErr_Clear();
  }
}

Ref code_name(PyObject* frame) {
  Ref code = Ref::steal(
      reinterpret_cast<PyObject*>(PyFrame_GetCode(reinterpret_cast<PyFrameObject*>(frame))));
  return Ref::borrow(reinterpret_cast<PyCodeObject*>(code.get())->co_name);
}

// The thread states of an interpreter, in its own order. Touching frames can run code that
// releases the interpreter lock, so threads may come and go while we work through the list:
// each one is checked to be still alive before it is used.
std::vector<PyThreadState*> thread_states(PyInterpreterState* interp) {
  std::vector<PyThreadState*> states;
  for (PyThreadState* ts = PyInterpreterState_ThreadHead(interp); ts != nullptr;
       ts = PyThreadState_Next(ts)) {
    states.push_back(ts);
  }
  return states;
}

bool thread_state_alive(PyInterpreterState* interp, PyThreadState* wanted) {
  for (PyThreadState* ts = PyInterpreterState_ThreadHead(interp); ts != nullptr;
       ts = PyThreadState_Next(ts)) {
    if (ts == wanted) return true;
  }
  return false;
}

void name_thread(ThreadData* data, PyObject* frame) {
  Ref caller = frame_back(frame);
  if (caller && compat::is_plain_frame(caller.get()) &&
      (__is_threading_bootstrap(caller.get()) || is_internal_frame(caller.get())) &&
      !is_internal_frame(frame)) {
    data->thread_name = code_name(frame);
  }
  if (!data->thread_name) data->thread_name = Ref::none();
}

// Gives another thread our C trace function where the interpreter lets us; returns whether
// it did. On 3.13 a thread installs itself at its next event instead.
bool monitoring_in_force() {
  return gSelf.event_source == kEventsFromMonitoring;
}

bool set_thread_trace(PyThreadState* ts, ThreadData* data, bool on) {
  if (monitoring_in_force()) {
    // Events reach every thread; the thread's flag says whether it takes them.
    data->events_off = on ? 0 : 1;
    data->global_trace_set = on ? 1 : 0;
    return true;
  }
  if (static_cast<bool>(data->global_trace_set) == on) return true;
  PinnedThreadData pin(data);  // dropping the old trace object can run any code
  bool done = on ? compat::set_trace_for_thread(ts, c_dispatch, gSelf.trace_dispatch.get())
                 : compat::set_trace_for_thread(ts, nullptr, nullptr);
  if (PyErr_Occurred() != nullptr) {
    DLOGEXCEPTION();
    PyErr_Clear();
    done = false;
  }
  if (done) data->global_trace_set = on ? 1 : 0;
  return done;
}

}  // namespace

int set_global_trace_function(int on) {
  PyThreadState* ts = compat::current_tstate();
  ThreadData* data = insert_thread_data(&gSelf.thread_table, ts);
  if (data == nullptr) {
    DLOGEXCEPTION();
    PyErr_Clear();
    return 1;
  }
  set_thread_trace(ts, data, on != 0);
  return 1;
}

void install_tracer_into_frames(PyThreadState* tstate) {
  ThreadData* data = insert_thread_data(&gSelf.thread_table, tstate);
  if (data == nullptr) {
    DLOGEXCEPTION();
    PyErr_Clear();
    return;
  }
  PinnedThreadData pin(data);  // replacing a frame's f_trace can run any code
  data->curr_frame = Ref::none();
  data->bot_frame = Ref::none();
  data->thread_name.reset();
  for (Ref frame = compat::tstate_frame(tstate); frame; frame = frame_back(frame.get())) {
    do_dprintf(kDbgFlow, "\tinserting into thread state %p; frame = %p\n", tstate, frame.get());
    if (!compat::is_plain_frame(frame.get())) continue;
    // f_trace belongs to the trace function: under sys.monitoring a Python tracer of another
    // tool (a coverage tool) would find ours there and call it.
    if (!monitoring_in_force()) set_f_trace(frame.get(), gSelf.trace_dispatch.get());
    data->bot_frame = frame;
    // Only the innermost frame decides the thread's name.
    if (!data->thread_name) name_thread(data, frame.get());
  }
  if (!data->thread_name) data->thread_name = Ref::none();
  data->tracer_in_frames = 1;
}

void remove_tracer_from_frames(PyThreadState* tstate) {
  ThreadData* data = find_thread_data(&gSelf.thread_table, tstate);
  if (data != nullptr) data->tracer_in_frames = 0;
  for (Ref frame = compat::tstate_frame(tstate); frame; frame = frame_back(frame.get())) {
    if (!compat::is_plain_frame(frame.get())) continue;
    Ref trace = get_f_trace(frame.get());
    if (!trace || !trace.is(gSelf.trace_dispatch.get())) continue;
    do_dprintf(kDbgFlow, "\tremoving from thread state; frame = %p\n", frame.get());
    set_f_trace(frame.get(), Py_None);
  }
}

void install_tracer(PyInterpreterState* interp) {
  std::vector<PyThreadState*> states = thread_states(interp);
  for (PyThreadState* ts : states) {
    if (thread_state_alive(interp, ts)) install_tracer_into_frames(ts);
  }
  // Threads that already run are traced from now on, not only once they happen to call
  // into something that installs us: all at once where the interpreter can, else one by one.
  // (sys.monitoring reaches every thread by itself.)
  bool all = !monitoring_in_force() &&
             compat::set_trace_all_threads(c_dispatch, gSelf.trace_dispatch.get());
  for (PyThreadState* ts : states) {
    if (!thread_state_alive(interp, ts)) continue;
    ThreadData* data = find_thread_data(&gSelf.thread_table, ts);
    if (data == nullptr) continue;
    if (all) {
      data->global_trace_set = 1;
    } else {
      set_thread_trace(ts, data, true);
    }
  }
}

namespace {
// Where the interpreter cannot clear one other thread's trace function (3.13), it can clear
// every thread's at once: done when every thread that has one has ours, so that no foreign
// tracer is touched.
void clear_remaining_trace_functions(PyInterpreterState* interp) {
  if (monitoring_in_force()) return;
  bool ours_left = false;
  for (PyThreadState* ts : thread_states(interp)) {
    Py_tracefunc func = compat::tstate_tracefunc(ts);
    if (func != nullptr && func != c_dispatch) return;
    if (func == c_dispatch && ts != compat::current_tstate()) ours_left = true;
  }
  if (!ours_left || !compat::set_trace_all_threads(nullptr, nullptr)) return;
  for (PyThreadState* ts : thread_states(interp)) {
    ThreadData* data = find_thread_data(&gSelf.thread_table, ts);
    if (data != nullptr) data->global_trace_set = 0;
  }
}
}  // namespace

void remove_tracer(PyInterpreterState* interp) {
  for (PyThreadState* ts : thread_states(interp)) {
    if (!thread_state_alive(interp, ts)) continue;
    remove_tracer_from_frames(ts);
    ThreadData* data = find_thread_data(&gSelf.thread_table, ts);
    // Other threads drop our C trace function now where the interpreter lets us.
    if (data != nullptr && ts != compat::current_tstate() &&
        (monitoring_in_force() || compat::tstate_tracefunc(ts) == c_dispatch)) {
      set_thread_trace(ts, data, false);
    }
  }
  clear_remaining_trace_functions(interp);
  // A thread still holding it finds tracing stopped at its next event and removes it.
}

void install_start_thread_hooks(int flag) {
  Ref args = Ref::steal(Py_BuildValue("(i)", flag));
  if (!args) {
    PyErr_SetString(PyExc_MemoryError, "Out of memory");
  } else if (gSelf.install_thread_hooks_cb) {
    // The server side's own code is never traced: start_trace calls this once tracing is
    // already on for the calling thread, which would otherwise stop inside the callback.
    PyThreadState* ts = compat::current_tstate();
    compat::tracing_add(ts, 1);
    Ref result = Ref::steal(PyObject_CallObject(gSelf.install_thread_hooks_cb.get(), args.get()));
    compat::tracing_add(ts, -1);
  }
  // The server side's failures here are not the caller's business: log and drop them.
  if (PyErr_Occurred() != nullptr) {
    DLOGEXCEPTION();
    PyErr_Clear();
  }
}

int __tracer_start_trace() {
  do_dprintf(kDbgFlow, "START TRACING\n");
  if (gSelf.trace_started) return 1;
  gSelf.event_source = gSelf.requested_event_source;
  if (monitoring_in_force() && monitoring_start() != 0) {
    gSelf.event_source = kEventsFromTrace;
    return 0;
  }
  gSelf.instruction_count = 0;
  gSelf.trace_started = 1;
  initial_module_scan();
  install_tracer(PyInterpreterState_Get());
  set_global_trace_function(1);
  install_start_thread_hooks(1);
  idle_ticker_update();
  return 1;
}

void __tracer_stop_trace() {
  do_dprintf(kDbgFlow, "in __tracer_stop_trace()\n");
  gSelf.trace_started = 0;
  remove_tracer(PyInterpreterState_Get());
  set_global_trace_function(0);
  if (monitoring_in_force()) monitoring_stop();
  install_start_thread_hooks(0);
  idle_ticker_update();
  // No event will come to drop them: the records would keep their exceptions, frames and
  // locals alive for the rest of the program.
  gSelf.exc_data.frame_exc_info.reset();
}

namespace {
bool full_path_pruned(PyObject* frame, char* buffer, size_t size) {
  const char* path = __tracer_get_full_path(&gSelf.co_pathname_table, frame);
  if (path == nullptr) {
    PyErr_Clear();
    return false;
  }
  // Longer names cannot be a module file we know; they are cut, never overflowed.
  strncpy(buffer, path, size - 1);
  buffer[size - 1] = '\0';
  prune_py_c_or_o(buffer);
  return true;
}

bool ends_with(const char* text, const char* suffix) {
  size_t n = strlen(text), m = strlen(suffix);
  return n >= m && memcmp(text + n - m, suffix, m) == 0;
}
}  // namespace

int __is_threading_bootstrap(PyObject* frame) {
  // Current interpreters start threads in Thread._bootstrap, which calls _bootstrap_inner.
  Ref name = code_name(frame);
  const char* text = PyUnicode_AsUTF8(name.get());
  if (text == nullptr) {
    PyErr_Clear();
    return 0;
  }
  if (strcmp(text, "_bootstrap_inner") != 0 && strcmp(text, "_bootstrap") != 0) return 0;
  static char buffer[kMaxPathLen + 1];
  return full_path_pruned(frame, buffer, sizeof buffer) && ends_with(buffer, "threading.py") ? 1
                                                                                             : 0;
}

int is_internal_frame(PyObject* frame) {
  static char buffer[kMaxPathLen + 1];
  if (!gSelf.internal_modules_map) return 0;
  if (!full_path_pruned(frame, buffer, sizeof buffer) || buffer[0] == '\0') return 0;
  Ref key = Ref::steal(gPtrTo_PyUnicode_FromString(buffer));
  if (!key) {
    PyErr_Clear();
    return 0;
  }
  int found = PyDict_Contains(gSelf.internal_modules_map.get(), key.get());
  if (found < 0) PyErr_Clear();
  return found == 1 ? 1 : 0;
}
