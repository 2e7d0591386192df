// dispatch.cpp: the trace function. c_dispatch decides which thread may enter the debugger,
// serialises entry with the selvane mutex, counts events, runs the idle callback, delivers
// injected exceptions, and hands each event to its handler, which calls the line, return or
// exception callback when the stepping state or a breakpoint says to stop.
//
// Nothing here may change what the program sees: errno is restored on every path, the
// pending exception is kept, and a failure switches tracing off for the thread instead of
// raising into user code.
#include "core/dispatch.h"

#include <cerrno>
#include <cstring>
#include <ctime>

#include "bp/breakhere.h"
#include "core/exception_dispatch.h"
#include "core/idleticker.h"
#include "core/imports.h"
#include "core/install.h"
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

// Set by the fork handler in the child; read once per event as a plain flag.
volatile int gForkSeen = 0;

class ErrnoGuard {
 public:
  ErrnoGuard() : saved_(errno) {}
  ~ErrnoGuard() { errno = saved_; }

 private:
  int saved_;
};

void check_fork() {
  gForkSeen = 0;
  gSelf.in_forked_child = getpid() != gSelf.pid ? 1 : 0;
}

// Debug output is diagnostics: while it is on, every event takes the mutex up front, in
// the order the messages describe.
bool debug_output_on() {
  return dprintf_wanted(kDbgFlow | kDbgExceptions | kDbgPathnames);
}

// Takes the mutex for `event` (see enter_debugger).
void enter_for(ThreadData* data, DispatchEvent& event) {
  if (event.entered) return;
  event.entered = true;
  event.tracing_at_entry = compat::tracing_get(compat::current_tstate());
  data->curr_frame = Ref::borrow(event.frame);
  acquire_selvane_mutex();
}

void leave_debugger(DispatchEvent& event) {
  if (!event.entered) return;
  // The interpreter holds one unit of the thread's tracing counter while it calls us and
  // takes it back when we return. A callback that lowered the counter without raising it
  // again (add_to_tstate_tracing) would make it negative then, which switches tracing off
  // for good or aborts a debug interpreter: the counter is put back here.
  if (compat::tracing_repair(compat::current_tstate(), event.tracing_at_entry)) {
    do_dprintf(kDbgFlow, "callback left the tracing counter below %d: restored\n",
               event.tracing_at_entry);
  }
  __tracer_clear_curr_frame();
  release_selvane_mutex();
  event.entered = false;
}

// The value a return event carries, or null when an exception left the frame. The trace
// function's return event does not say which: the frame's latest event does. sys.monitoring
// tells (PY_UNWIND comes without a value).
PyObject* return_value(ThreadData* data, PyFrameObject* frame, PyObject* arg, bool monitoring) {
  return monitoring ? arg : compat::return_value_of_event(data->last_exception_frame, frame, arg);
}

int dispatch_by_event(ThreadData* data, PyFrameObject* frame, int what, PyObject* arg,
                      bool monitoring, bool* propagate) {
  PyObject* f = reinterpret_cast<PyObject*>(frame);
  int result = 0;
  switch (what) {
    case PyTrace_CALL:
      result = dispatch_call(data, f);
      if (result == -2) {
        do_dprintf(kDbgFlow, "PROPAGATING EXCEPTION INTO USER CODE\n");
        *propagate = true;
        return 0;
      }
      if (result != 0) {
        do_dprintf(kDbgFlow, "TRACER CALL STOPPED TRACER\n");
        return -1;
      }
      return 0;
    case PyTrace_EXCEPTION:
      result = dispatch_exception(f, arg);
      if (result != 0) do_dprintf(kDbgFlow, "TRACER EXC STOPPED TRACER\n");
      return result != 0 ? -1 : 0;
    case PyTrace_LINE:
      result = dispatch_line(data, f);
      if (result != 0) do_dprintf(kDbgFlow, "TRACER LINE STOPPED TRACER\n");
      return result != 0 ? -1 : 0;
    case PyTrace_RETURN:
      result = dispatch_return(data, f, return_value(data, frame, arg, monitoring));
      if (result != 0) do_dprintf(kDbgFlow, "TRACER RETURN STOPPED TRACER\n");
      return result != 0 ? -1 : 0;
    default:
      return 0;
  }
}

// A new frame gets trace_dispatch in f_trace when the thread traces through it, so that
// jumps (setting f_lineno) work from the callbacks.
void give_frame_f_trace(PyThreadState* ts, PyFrameObject* frame) {
  if (!gSelf.trace_dispatch.is(compat::tstate_traceobj(ts))) return;
  PyObject* f = reinterpret_cast<PyObject*>(frame);
  Ref current = compat::frame_get_trace(f);
  if (current && !current.is_none()) return;
  if (!current || compat::frame_set_trace(f, gSelf.trace_dispatch.get()) != 0) PyErr_Clear();
}

// Steps 8 to 11 of an event, once the thread may enter. Returns the trace function's result.
// `data` is pinned by the caller: a reset while this thread waited or ran Python code has
// renewed it in place, so it always describes the session in force now.
int run_event(PyThreadState* ts, ThreadData* data, PyFrameObject* frame, int what, PyObject* arg,
              bool monitoring) {
  bool stopped = false;
  bool propagate = false;
  // The event may come at the program's recursion limit, where the program may even be
  // raising RecursionError: the core's Python calls (callbacks, hooks, the attributes its
  // decisions read) must not fail there, which would also switch tracing off for the thread.
  compat::RecursionRoom room(kCoreRecursionRoom);
  if (!__ensure_tracer_status(ts, data)) {
    do_dprintf(kDbgFlow, "TRACER STOPPED WHILE WAITING FOR MUTEX\n");
  } else {
    ++gSelf.instruction_count;
    if (gSelf.idle_period > 0 && do_idle() != 0) {
      do_dprintf(kDbgFlow, "IDLE STOPPED TRACER\n");
      stopped = true;
    } else {
      stopped = dispatch_by_event(data, frame, what, arg, monitoring, &propagate) != 0;
      if (!stopped && !propagate && what == PyTrace_CALL) give_frame_f_trace(ts, frame);
    }
  }
  if (stopped || !gSelf.trace_started) {
    enter_debugger();
    // A failed callback switches tracing off for this thread and never raises into the
    // program's frames: the interpreter reports the error as an unraisable exception.
    if (PyErr_Occurred() != nullptr) PyErr_WriteUnraisable(gSelf.trace_dispatch.get());
    remove_tracer_from_frames(ts);
    set_global_trace_function(0);
    PyErr_Clear();
  }
  return propagate ? -1 : 0;
}

}  // namespace

void note_fork_in_child() {
  gForkSeen = 1;
}

void enter_debugger() {
  ThreadData* data = current_thread_data_or_insert(&gSelf.thread_table);
  if (data == nullptr) {
    PyErr_Clear();
    return;
  }
  if (data->dispatch_event != nullptr) enter_for(data, *data->dispatch_event);
}

namespace {

bool is_threading_bootstrap_code(PyCodeObject* code) {
  const char* name = PyUnicode_AsUTF8(code->co_name);
  const char* file = PyUnicode_AsUTF8(code->co_filename);
  if (name == nullptr || file == nullptr) {
    PyErr_Clear();
    return false;
  }
  size_t length = std::strlen(file);
  return (std::strcmp(name, "_bootstrap_inner") == 0 || std::strcmp(name, "_bootstrap") == 0) &&
         length >= 12 && std::strcmp(file + length - 12, "threading.py") == 0;
}

PyCodeObject* code_of(PyFrameObject* frame) {  // new reference
  return PyFrame_GetCode(frame);
}

bool is_bootstrap_frame(PyFrameObject* frame) {
  PyCodeObject* code = code_of(frame);
  bool found = is_threading_bootstrap_code(code);
  Py_DECREF(code);
  return found;
}

// Where a thread's own code starts, as the bootstrap calls it: run(), or a function of
// another file than the bootstrap's (its helpers before and after run() share its file) that
// is not the debugger's own (a server side may wrap the bootstrap).
bool is_run_called_by_bootstrap(PyFrameObject* frame) {
  PyFrameObject* caller = PyFrame_GetBack(frame);  // new reference or null
  if (caller == nullptr) return false;
  PyCodeObject* caller_code = code_of(caller);
  Py_DECREF(caller);
  PyCodeObject* code = code_of(frame);
  bool found = false;
  if (is_threading_bootstrap_code(caller_code)) {
    const char* name = PyUnicode_AsUTF8(code->co_name);
    if (name == nullptr) PyErr_Clear();
    int same_file = PyUnicode_Compare(code->co_filename, caller_code->co_filename);
    if (same_file == -1 && PyErr_Occurred() != nullptr) PyErr_Clear();
    found = (name != nullptr && std::strcmp(name, "run") == 0) ||
            (same_file != 0 && !is_internal_frame(reinterpret_cast<PyObject*>(frame)));
  }
  Py_DECREF(code);
  Py_DECREF(caller_code);
  return found;
}

// Under sys.monitoring, whether an event of the calling thread is the program's. The trace
// function sees a thread that threading started from its run() on, where the thread start
// hook fires; sys.monitoring also reports the thread machinery's frames before run() and
// after it, which are passed over (see ThreadData::run_reached). No record is made for them.
bool monitoring_event_wanted(PyThreadState* ts, PyFrameObject* frame, int what) {
  ThreadData* data = find_thread_data(&gSelf.thread_table, ts);
  if (data != nullptr && data->events_off) return false;  // switched off for this thread
  if (data != nullptr && data->run_reached == 1) return true;
  if (data == nullptr || data->run_reached == -1) {
    // A thread inside run() already, or one that threading did not start, is the program's.
    Ref outermost;
    bool in_run = false;
    for (Ref walk = Ref::borrow(reinterpret_cast<PyObject*>(frame)); walk;
         walk = frame_back(walk.get())) {
      in_run = in_run || is_run_called_by_bootstrap(reinterpret_cast<PyFrameObject*>(walk.get()));
      outermost = walk;
    }
    bool started = in_run || !outermost ||
                   !is_bootstrap_frame(reinterpret_cast<PyFrameObject*>(outermost.get()));
    if (data != nullptr) data->run_reached = started ? 1 : 0;
    if (started) return true;
  }
  if (what != PyTrace_CALL || !is_run_called_by_bootstrap(frame)) return false;
  if (data != nullptr) data->run_reached = 1;
  return true;
}

// One event from either source: which thread may enter, the mutex, and the handlers.
int dispatch_event(PyFrameObject* frame, int what, PyObject* arg, bool monitoring) {
  ErrnoGuard errno_guard;
  if (gForkSeen) check_fork();
  if (gSelf.in_forked_child) return 0;
  PyThreadState* ts = compat::current_tstate();
  // The thread state's identity is what get_thread_ident answers, without the call.
  unsigned long identity = compat::tstate_thread_id(ts);
  if (gSelf.pending_exception_count != 0 &&
      __tracer_raise_pending_exception(find_thread_data(&gSelf.thread_table, ts))) {
    return -1;
  }
  if (gSelf.selvane_mutex_owner == identity) {
    do_dprintf(kDbgFlow, "recursive c_dispatch\n");
    return 0;
  }
  if (!gSelf.debug_all_threads && gSelf.selvane_mutex_owner != kNoMutexOwner) {
    do_dprintf(kDbgFlow, "ignoring thread in c_dispatch\n");
    return 0;
  }
  // (Before the thread policy: the thread is asked about once it runs the program's code.)
  if (monitoring && !monitoring_event_wanted(ts, frame, what)) return 0;
  if (gSelf.debug_thread_cb && !__should_debug_thread(identity)) {
    do_dprintf(kDbgFlow, "ignore thread by policy\n");
    return 0;
  }
  ThreadData* data = thread_data_for(&gSelf.thread_table, ts);
  if (data == nullptr) {
    PyErr_Clear();
    return 0;
  }
  if (!monitoring) compat::note_event(data->last_exception_frame, frame, what);
  // Whatever happens to the core while this event waits or runs callbacks (another thread
  // may reset or re-initialise it), the record stays valid until the event ends.
  PinnedThreadData pin(data);
  DispatchEvent event{reinterpret_cast<PyObject*>(frame), false, data->dispatch_event, 0};
  data->dispatch_event = &event;
  // Another thread inside the debugger: wait for it here, before anything is decided.
  if (gSelf.selvane_mutex_owner != kNoMutexOwner || debug_output_on()) enter_for(data, event);
  int result = run_event(ts, data, frame, what, arg, monitoring);
  if (data->dispatch_event == &event) data->dispatch_event = event.outer;
  leave_debugger(event);
  return result;
}

}  // namespace

int c_dispatch(PyObject*, PyFrameObject* frame, int what, PyObject* arg) {
  return dispatch_event(frame, what, arg, false);
}

int dispatch_monitoring_event(PyFrameObject* frame, int what, PyObject* arg) {
  return dispatch_event(frame, what, arg, true);
}

PyObject* _tracer_trace_dispatch(PyObject* self, PyObject* args) {
  if (!PyTuple_Check(args) || PyTuple_GET_SIZE(args) != 3) {
    PyErr_SetString(PyExc_TypeError, "trace_dispatch takes (frame, event, arg)");
    return nullptr;
  }
  PyObject* frame = PyTuple_GET_ITEM(args, 0);
  PyObject* event = PyTuple_GET_ITEM(args, 1);
  PyObject* arg = PyTuple_GET_ITEM(args, 2);
  if (!compat::is_plain_frame(frame)) {
    PyErr_SetString(PyExc_TypeError, "trace_dispatch needs a frame");
    return nullptr;
  }
  if (gSelf.event_source == kEventsFromMonitoring && gSelf.trace_started) {
    // sys.monitoring delivers every event already; a thread start hook that installed this
    // function as the thread's trace function would only double them.
    PyThreadState* ts = compat::current_tstate();
    if (gSelf.trace_dispatch.is(compat::tstate_traceobj(ts))) PyEval_SetTrace(nullptr, nullptr);
    if (PyErr_Occurred() != nullptr) return nullptr;
    Py_RETURN_NONE;
  }
  const char* name = _pystring_to_c_string(event);
  int what = -1;
  switch (name != nullptr ? name[0] : '\0') {
    case 'c':
      what = PyTrace_CALL;
      break;
    case 'e':
      what = PyTrace_EXCEPTION;
      break;
    case 'l':
      what = PyTrace_LINE;
      break;
    case 'r':
      what = PyTrace_RETURN;
      break;
    default:
      break;
  }
  int result = what < 0 ? 0 : c_dispatch(self, reinterpret_cast<PyFrameObject*>(frame), what, arg);
  if (result != 0) {
    if (PyErr_Occurred() != nullptr) return nullptr;
    Py_RETURN_NONE;
  }
  if (!gSelf.trace_dispatch) Py_RETURN_NONE;  // before init there is nothing to keep
  // Switch the thread from the Python-level trampoline to direct C tracing.
  PyThreadState* ts = compat::current_tstate();
  if (gSelf.trace_dispatch && gSelf.trace_dispatch.is(compat::tstate_traceobj(ts)) &&
      compat::tstate_tracefunc(ts) != c_dispatch) {
    PyEval_SetTrace(c_dispatch, gSelf.trace_dispatch.get());
    if (PyErr_Occurred() != nullptr) return nullptr;
  }
  return gSelf.trace_dispatch.new_ref();
}

int __ensure_tracer_status(PyThreadState* ts, ThreadData* data) {
  if (!gSelf.trace_started) {
    enter_debugger();
    do_dprintf(kDbgFlow, "trace_dispatch called while not tracing; thread = %ld\n",
               compat::tstate_thread_id(ts));
    remove_tracer_from_frames(ts);
    set_global_trace_function(0);
    return 0;
  }
  if (data->tracer_in_frames && data->global_trace_set) return 1;
  enter_debugger();
  if (!data->tracer_in_frames) install_tracer_into_frames(ts);
  // Installing may run code that resets the core: look the record up again.
  data = thread_data_for(&gSelf.thread_table, ts);
  if (data != nullptr && !data->global_trace_set) set_global_trace_function(1);
  return 1;
}

namespace {

bool is_module_level(PyObject* frame) {
  auto* f = reinterpret_cast<PyFrameObject*>(frame);
  Ref code = Ref::steal(reinterpret_cast<PyObject*>(PyFrame_GetCode(f)));
  // Function code has its own fast locals: asking for them would sync them into a dict.
  if (reinterpret_cast<PyCodeObject*>(code.get())->co_flags & CO_OPTIMIZED) return false;
  Ref locals = Ref::steal(PyFrame_GetLocals(f));
  Ref globals = Ref::steal(PyFrame_GetGlobals(f));
  if (!locals) PyErr_Clear();
  return locals && locals.get() == globals.get();
}

void print_call(PyObject* frame) {
  if (!dprintf_wanted(kDbgFlow)) return;
  auto* f = reinterpret_cast<PyFrameObject*>(frame);
  Ref locals = Ref::steal(PyFrame_GetLocals(f));
  if (!locals) PyErr_Clear();
  Ref globals = Ref::steal(PyFrame_GetGlobals(f));
  do_dprintf(kDbgFlow, "in call: locals = %p, globals = %p, thread = %ld\n", locals.get(),
             globals.get(), get_thread_ident());
}

// Makes sure a function's code object knows its file; -2 when the lookup failed.
int register_function_code(PyObject* frame) {
  COPathnameTable* table = &gSelf.co_pathname_table;
  // The periodic sweep releases code objects, which can run arbitrary code.
  if (table->sweep_counter >= 4999) enter_debugger();
  Ref code = Ref::steal(
      reinterpret_cast<PyObject*>(PyFrame_GetCode(reinterpret_cast<PyFrameObject*>(frame))));
  if (LookupCOPathname(table, code.get()) != nullptr) return 0;
  if (PyErr_Occurred() != nullptr) return -2;
  PyObject* filename = reinterpret_cast<PyCodeObject*>(code.get())->co_filename;
  __resolve_module_full_path(table, nullptr, filename, code.get());
  return 0;
}

// Calls the line callback for a stop at `frame`. Only a stop runs Python code: the thread's
// exception state is kept around it, and a failing callback's error is what the interpreter
// reports. 0, or -1 when the callback failed.
int line_stop(PyObject* frame) {
  compat::PendingError saved;
  saved.fetch();
  if (do_callback(gSelf.line_cb.get(), frame, nullptr) == 0) {
    saved.restore();
    return 0;
  }
  compat::PendingError failure;
  failure.fetch();
  saved.restore();
  PyErr_Clear();
  failure.restore();
  return -1;
}

}  // namespace

int dispatch_call(ThreadData* data, PyObject* frame) {
  if (!gSelf.trace_started) return -1;
  if (!compat::is_plain_frame(frame)) return 0;
  print_call(frame);
  if (!is_module_level(frame)) {
    if (register_function_code(frame) == -2) return -2;
  } else {
    // Module-level code: registering it can release code objects and run any code.
    enter_debugger();
    if (__tracer_top_level_call(frame) != 0) return -2;
  }
  if (data->bot_frame.is_none()) data->bot_frame = Ref::borrow(frame);
  // Entering a key frame is a step of the sub-language program: its hook may stop there.
  __tracer_sub_language_dispatch_call(data, frame);
  // (While the import callback runs nothing stops.)
  if (data->sub_language_hook && !gSelf.in_import_cb &&
      __tracer_sub_language_stop_here(data, frame, 0)) {
    return line_stop(frame);
  }
  return 0;
}

namespace {

// The exception value of a record: the second item of the event's argument.
PyObject* recorded_value(PyObject* recorded) {
  return PyTuple_Check(recorded) && PyTuple_GET_SIZE(recorded) > 1 ? PyTuple_GET_ITEM(recorded, 1)
                                                                   : nullptr;
}

// A frame on a line of its own is done with the exception recorded for it, unless it is
// still handling that very exception (an except, finally or with-exit block, which may yet
// raise it again) or just entering the handler that will (its line event comes before the
// interpreter shows the exception as handled; a with block's exit still decides whether the
// exception leaves the frame). The trace function reports no handling: this is where a
// caught exception's record goes, so that it keeps nothing alive past the handler's end.
void forget_exception_left_behind(PyObject* frame) {
  if (!gSelf.exc_data.frame_exc_info) return;
  PyObject* recorded = find_frame_exc_info(&gSelf.exc_data.frame_exc_info, frame);
  if (recorded == nullptr) return;
  Ref handled = Ref::steal(PyErr_GetHandledException());
  if (handled && handled.get() == recorded_value(recorded)) return;
  if (frame_entering_handler(frame)) return;
  enter_debugger();  // dropping the record can run finalizers
  forget_frame_exc_info(&gSelf.exc_data.frame_exc_info, frame);
}

}  // namespace

int dispatch_line(ThreadData* data, PyObject* frame) {
  if (!gSelf.trace_started) return -1;
  if (!compat::is_plain_frame(frame)) return 0;
  forget_exception_left_behind(frame);
  if (dprintf_wanted(kDbgFlow)) {
    const char* path = __tracer_get_full_path(&gSelf.co_pathname_table, frame);
    if (path == nullptr) PyErr_Clear();
    do_dprintf(kDbgFlow, "in dispatch_line: file=%s, lineno=%d\n", dprint_check_str(path),
               PyFrame_GetLineNumber(reinterpret_cast<PyFrameObject*>(frame)));
  }
  if (!stop_here_for(data, frame, 1) &&
      !__tracer_break_here(&gSelf.bp_ops_data, 1, data, frame, 1)) {
    return 0;
  }
  return line_stop(frame);
}

namespace {

bool untraced_after_stop(PyObject* frame) {
  if (gSelf.trace_started) return false;
  Ref trace = compat::frame_get_trace(frame);
  if (!trace) PyErr_Clear();
  return !trace || trace.is_none();
}

}  // namespace

void call_quit_cb_if_autoquit() {
  if (!gSelf.autoquit || !gSelf.quit_cb) return;
  enter_debugger();
  compat::PendingError saved;
  saved.fetch();
  Ref result = Ref::steal(PyObject_CallNoArgs(gSelf.quit_cb.get()));
  saved.restore();
}

namespace {
// The frame returns: its exception record, if any, is no longer needed.
int forget_exception_of(PyObject* frame, int result) {
  if (gSelf.exc_data.frame_exc_info) {
    enter_debugger();  // dropping a record can run finalizers
    forget_frame_exc_info(&gSelf.exc_data.frame_exc_info, frame);
  }
  return result;
}
}  // namespace

namespace {
int decide_return(ThreadData* data, PyObject* frame, PyObject* retval) {
  if (!gSelf.trace_started) return -1;
  if (retval == nullptr) {
    // Left by an exception: the latest exception event in the frame says which one.
    Ref recorded = Ref::borrow(find_frame_exc_info(&gSelf.exc_data.frame_exc_info, frame));
    if (dispatch_exception_return(frame, recorded.get()) != 0)
      return forget_exception_of(frame, -1);
    if (untraced_after_stop(frame)) return 0;
  }
  // A step-out stops at the frame it leaves, unless that is a sub-language frame, where only
  // the stepping state decides (the frame category is asked only when the frame matches).
  bool stop = (data->step_out_frame.is(frame) &&
               __tracer_sub_language_get_frame_category(data, frame) == -1) ||
              stop_here_for(data, frame, 2);
  if (stop) {
    PyObject* value = retval != nullptr ? retval : Py_None;
    if (do_callback(gSelf.return_cb.get(), frame, value) != 0)
      return forget_exception_of(frame, -1);
  } else if (data->bot_frame.is(frame)) {
    unsigned long identity = data->thread_id;
    enter_debugger();  // dropping the frame may run finalizers
    data->bot_frame = Ref::none();
    call_quit_cb_if_autoquit();
    __clear_should_debug_thread_cache(identity);
    if (untraced_after_stop(frame)) return 0;
  }
  return forget_exception_of(frame, 0);
}
}  // namespace

int dispatch_return(ThreadData* data, PyObject* frame, PyObject* retval) {
  int result = decide_return(data, frame, retval);
  // Whichever way the frame is left, a marker frame takes its sub-language with it.
  __tracer_sub_language_dispatch_return(data, frame);
  return result;
}

int do_callback(PyObject* cb, PyObject* frame, PyObject* arg) {
  enter_debugger();
  if (cb == nullptr) return 0;
  compat::RecursionRoom room(kCoreRecursionRoom);
  Ref changed = Ref::steal(__tracer_get_changed_bps_lists(&gSelf.bp_ops_data));
  if (!changed) return -1;
  Ref result = Ref::steal(arg == nullptr ? do_two_arg_call(cb, frame, changed.get())
                                         : do_three_arg_call(cb, frame, arg, changed.get()));
  return result ? 0 : -1;
}

int do_idle() {
  if (!gSelf.trace_started) return -1;
  if (gSelf.in_idle || !(gSelf.idle_period > 0)) return 0;
  gSelf.in_idle = 1;
  idle_ticker_resume_after_fork();
  if (++gSelf.idle_tick > gSelf.idle_tick_limit) {
    gSelf.idle_tick = 0;
    time_t now = time(nullptr);
    if (gSelf.next_idle_time <= now) {
      gSelf.next_idle_time = now + 1;
      enter_debugger();
      // The idle callback's result is not ours; its error would leak into the program.
      Ref result = Ref::steal(PyObject_CallNoArgs(gSelf.idle_cb.get()));
      if (!result) {
        DLOGEXCEPTION();
        PyErr_Clear();
      }
    }
  }
  gSelf.in_idle = 0;
  return 0;
}
