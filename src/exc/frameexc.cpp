// frameexc.cpp: the exception argument recorded per frame until the frame returns (see
// exceptops.h).
//
// The interpreter's return event for a frame left by an exception does not say which
// exception it was; the latest exception event in that frame did. A record holds the
// traceback and so the frame: records whose frames nothing else refers to any more are
// collected on every store and removal, at most 100 at a time.
#include "exc/exceptops.h"

#include "support/dprintf.h"
#include "support/pycompat.h"

namespace {

constexpr int kCollectBatch = 100;
constexpr int kTracebackWalkLimit = 1000;

// A recorded argument that the collector understands: (type, value, traceback, ...).
PyObject* traceback_of(PyObject* value) {
  if (!PyTuple_CheckExact(value) || PyTuple_GET_SIZE(value) < 3) return nullptr;
  PyObject* tb = PyTuple_GET_ITEM(value, 2);
  return PyTraceBack_Check(tb) && Py_IS_TYPE(tb, &PyTraceBack_Type) ? tb : nullptr;
}

// A frame is alive while something besides its record (the key and the record's own
// traceback) refers to it. Frames are ordinary reference-counted objects on every version we
// support once the interpreter has handed one to a trace function, so the count is the test.
bool record_is_dead(PyObject* frame, PyObject* value) {
  Py_ssize_t count = Py_REFCNT(frame);
  if (count <= 1) return true;
  PyObject* tb = traceback_of(value);
  return tb != nullptr && count - ref_count_in_tb(tb, frame) < 2;
}

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

Py_ssize_t ref_count_in_tb(PyObject* traceback, PyObject* frame) {
  Py_ssize_t count = 0;
  int visited = 0;
  // The traceback's own fields: no attribute lookup (and no name object) per entry, and no
  // code runs, so the chain cannot change under the walk.
  for (PyObject* tb = traceback; tb != nullptr && PyTraceBack_Check(tb);
       tb = reinterpret_cast<PyObject*>(reinterpret_cast<PyTracebackObject*>(tb)->tb_next)) {
    if (++visited > kTracebackWalkLimit) return 0;
    PyObject* tb_frame =
        reinterpret_cast<PyObject*>(reinterpret_cast<PyTracebackObject*>(tb)->tb_frame);
    // Counted once per entry whose back chain passes the frame: an estimate, on purpose.
    for (Ref f = Ref::borrow(tb_frame); f && compat::is_plain_frame(f.get());
         f = compat::frame_back(reinterpret_cast<PyFrameObject*>(f.get()))) {
      if (f.is(frame)) ++count;
    }
  }
  return count;
}

int gc_exc_info_for_frame(Ref* frame_exc_info) {
  PyObject* dict = frame_exc_info->get();
  if (dict == nullptr || !PyDict_Check(dict)) return 0;
  PyObject* dead[kCollectBatch];
  int found = 0;
  Py_ssize_t pos = 0;
  PyObject *key, *value;
  while (found < kCollectBatch && PyDict_Next(dict, &pos, &key, &value)) {
    if (record_is_dead(key, value)) dead[found++] = Py_NewRef(key);
  }
  int result = 0;
  for (int i = 0; i < found; ++i) {
    if (result == 0 && PyDict_DelItem(dict, dead[i]) != 0) result = -1;
    Py_DECREF(dead[i]);
  }
  return result;
}

int set_frame_exc_info(Ref* frame_exc_info, PyObject* frame, PyObject* exc_arg) {
  do_dprintf(kDbgExceptions, "set_frame_exc_info\n");
  if (!*frame_exc_info) {
    Ref dict = Ref::steal(PyDict_New());
    if (!dict) return -1;
    *frame_exc_info = dict;
  } else if (gc_exc_info_for_frame(frame_exc_info) != 0) {
    PyErr_Clear();
  }
  // Held for the store: collecting above may have run finalizers that replaced the field.
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
  gc_exc_info_for_frame(frame_exc_info);
  PyErr_Clear();
  release_if_empty(frame_exc_info);
  saved.restore();
  return 0;
}
