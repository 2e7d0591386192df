// stepping.cpp: whether the stepping command in force stops at a line, return or exception
// event, and the commands that set the stepping state of the calling thread.
#include "core/stepping.h"

#include "bp/breakhere.h"
#include "core/monitoring.h"
#include "core/sublang.h"
#include "core/tracercore.h"
#include "support/dbgcommon.h"
#include "support/dprintf.h"
#include "support/pycompat.h"

namespace {

int frame_line(PyObject* frame) {
  return PyFrame_GetLineNumber(reinterpret_cast<PyFrameObject*>(frame));
}

bool outside_line_range(const ThreadData* data, PyObject* frame) {
  if (data->line_range_start == -1) return true;
  int line = frame_line(frame);
  return line < data->line_range_start || line > data->line_range_end;
}

// Called only where the answer is "stop": keeps breakpoint hit counts current.
void count_breakpoint_hit(ThreadData* data, PyObject* frame, int event) {
  __tracer_break_here(&gSelf.bp_ops_data, event, data, frame, 1);
}

// True when the bottom frame is reached before the stop frame: the stop frame has left the
// stack and the thread stops wherever it is now.
bool stop_frame_gone(ThreadData* data, PyObject* frame) {
  for (Ref f = Ref::borrow(frame); f; f = frame_back(f.get())) {
    if (f.is(data->stop_frame.get())) return false;
    if (f.is(data->bot_frame.get())) return true;
  }
  return false;
}

void set_stepping(ThreadData* data, Ref stop_frame, Ref step_out_frame, int first, int last) {
  data->stop_frame = std::move(stop_frame);
  data->step_out_frame = std::move(step_out_frame);
  data->line_range_start = first;
  data->line_range_end = last;
  // A command that can stop at a line needs the lines that went quiet (sys.monitoring).
  if (data->stop_frame || !data->step_out_frame.is_none()) monitoring_lines_needed();
}

// Nothing stops while the import callback runs or once tracing has stopped, whatever the
// thread's stepping state.
bool stops_suspended() {
  if (gSelf.in_import_cb) {
    do_dprintf(kDbgFlow, "Not stopping here because import callback is active\n");
    return true;
  }
  if (!gSelf.trace_started) {
    do_dprintf(kDbgFlow, "Not stopping here because no longer tracing\n");
    return true;
  }
  return false;
}

int decide_stop(ThreadData* data, PyObject* frame, int event);

}  // namespace

int __tracer_stop_here(PyObject* frame, int event) {
  if (stops_suspended()) return 0;
  ThreadData* data = current_thread_data_or_insert(&gSelf.thread_table);
  if (data == nullptr) {
    PyErr_Clear();
    do_dprintf(kDbgFlow, "ERROR: UNEXPECTED thread_data == NULL (while still tracing)!\n");
    return 0;
  }
  return decide_stop(data, frame, event);
}

int stop_here_for(ThreadData* data, PyObject* frame, int event) {
  return stops_suspended() ? 0 : decide_stop(data, frame, event);
}

namespace {

// The thread's stepping state decides (the sub-language hook, once there is one, first).
int decide_stop(ThreadData* data, PyObject* frame, int event) {
  if (data->sub_language_hook) {
    if (__tracer_sub_language_stop_here(data, frame, event)) return 1;
    // The implementation's own frames never stop; a failed lookup counts as one of them.
    if (__tracer_sub_language_in_impl(data, frame) != 0) {
      PyErr_Clear();
      return 0;
    }
  }
  if (!data->stop_frame) {
    do_dprintf(kDbgFlow, "Not stopping here because stop_frame == NULL\n");
    return 0;
  }
  if (data->stop_frame.is_none()) {
    count_breakpoint_hit(data, frame, event);
    do_dprintf(kDbgFlow, "Stopping here because stop_frame == None\n");
    return 1;
  }
  if (data->stop_frame.is(frame)) {
    if (outside_line_range(data, frame)) {
      count_breakpoint_hit(data, frame, event);
      do_dprintf(kDbgFlow, "Stopping here because stop_frame == current frame\n");
      return 1;
    }
    return 0;  // within the stepped-over range
  }
  if (stop_frame_gone(data, frame)) {
    Ref bot_frame = data->bot_frame;
    count_breakpoint_hit(data, bot_frame.get(), event);
    do_dprintf(kDbgFlow, "Stopping because bot_frame is found before the stop frame\n");
    return 1;
  }
  return 0;
}

}  // namespace

void __tracer_step_into(ThreadData* data) {
  set_stepping(data, Ref::none(), Ref::none(), -1, -1);
}

void __tracer_step_over(ThreadData* data) {
  set_stepping(data, data->curr_frame, Ref::none(), -1, -1);
}

void __tracer_step_over_line(ThreadData* data) {
  int line =
      compat::is_plain_frame(data->curr_frame.get()) ? frame_line(data->curr_frame.get()) : -1;
  set_stepping(data, data->curr_frame, Ref::none(), line, line);
}

void __tracer_step_over_line_range(ThreadData* data, int first, int last) {
  set_stepping(data, data->curr_frame, Ref::none(), first, last);
}

int __tracer_step_out(ThreadData* data) {
  Ref target;
  if (data->sub_language_hook) {
    // The sub-language says where its step-out ends; if it cannot, nothing changes.
    target = Ref::steal(__tracer_sub_language_step_out_frame(data, data->curr_frame.get()));
    if (!target) return 0;
  } else {
    target = frame_back(data->curr_frame.get());
    if (!target) target = Ref::none();
  }
  set_stepping(data, target, data->curr_frame, -1, -1);
  return 1;
}

void __tracer_continue_run(ThreadData* data) {
  set_stepping(data, Ref(), Ref::none(), -1, -1);
}

void __tracer_stop(ThreadData* data) {
  // A pending step-out still stops at its frame's return.
  set_stepping(data, Ref::none(), data->step_out_frame, -1, -1);
}
