// frameexc.cpp: the exception argument recorded per frame while that exception is in flight
// through the frame (see exceptops.h).
//
// The interpreter's return event for a frame left by an exception does not say which
// exception it was; the latest exception event in that frame did. A record holds the event's
// argument, so its traceback, its frames and their locals: it must live no longer than the
// interpreter itself keeps the exception going through the frame. The dispatcher therefore
// drops a frame's record as soon as the frame is done with the exception: the frame returns
// (by value or by the exception), the exception is handled there (sys.monitoring says so),
// or the frame moves on to a line of its own. Each record is thus dropped by an event of its
// own frame, at a cost independent of how many exceptions came before: no collector walks
// the records or the tracebacks, and the dictionary holds at most the frames an exception is
// passing through right now.
#include "exc/exceptops.h"

#include "support/dprintf.h"
#include "support/pycompat.h"

namespace {

void release_if_empty(Ref* frame_exc_info) {
  PyObject* dict = frame_exc_info->get();
  if (dict != nullptr && (!PyDict_Check(dict) || PyDict_GET_SIZE(dict) == 0)) {
    frame_exc_info->reset();
  }
}

}  // namespace

void init_exc_data(ExcData* data) {
  data->frame_exc_info.reset();
  data->catch_info.reset();
  data->co_name_str.reset();
  data->mod_name_str.reset();
  data->prints_str.reset();
  data->parent_str.reset();
}

void reset_exc_data(ExcData* data) {
  // The catch-info index survives a reset: only the next list given replaces it.
  data->frame_exc_info.reset();
  data->co_name_str.reset();
  data->mod_name_str.reset();
  data->prints_str.reset();
  data->parent_str.reset();
}

int set_frame_exc_info(Ref* frame_exc_info, PyObject* frame, PyObject* exc_arg) {
  do_dprintf(kDbgExceptions, "set_frame_exc_info\n");
  if (!*frame_exc_info) {
    Ref dict = Ref::steal(PyDict_New());
    if (!dict) return -1;
    *frame_exc_info = dict;
  }
  // Held for the store: replacing a record can run finalizers that replace the field.
  Ref dict = *frame_exc_info;
  if (!dict || PyDict_SetItem(dict.get(), frame, exc_arg) != 0) return -1;
  return 0;
}

PyObject* find_frame_exc_info(Ref* frame_exc_info, PyObject* frame) {
  PyObject* dict = frame_exc_info->get();
  if (dict == nullptr || !PyDict_Check(dict)) return nullptr;
  PyObject* value = PyDict_GetItemWithError(dict, frame);  // borrowed
  if (value == nullptr && PyErr_Occurred() != nullptr) PyErr_Clear();
  return value;
}

int forget_frame_exc_info(Ref* frame_exc_info, PyObject* frame) {
  if (!*frame_exc_info) return 0;
  // The frame is usually unwinding with its exception set: the bookkeeping keeps it.
  compat::PendingError saved;
  saved.fetch();
  Ref dict = *frame_exc_info;
  if (PyDict_Check(dict.get())) {
    int present = PyDict_Contains(dict.get(), frame);
    if (present > 0 && PyDict_DelItem(dict.get(), frame) != 0) PyErr_Clear();
    if (present < 0) PyErr_Clear();
  }
  release_if_empty(frame_exc_info);
  saved.restore();
  return 0;
}
