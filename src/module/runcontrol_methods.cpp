// runcontrol_methods.cpp: the run-control switches (autoquit, idle period, which threads are
// debugged), the thread queries and the selvane mutex methods. Thin: each stores into or
// reads from the tracer record or a thread's record.
#include <Python.h>

#include "core/idleticker.h"
#include "core/monitoring.h"
#include "core/thread_policy.h"
#include "core/tracercore.h"
#include "module/methods.h"
#include "support/pycompat.h"
#include "threads/threadops.h"

PyObject* _tracer_set_autoquit(PyObject*, PyObject* args) {
  int value = 0;
  if (!PyArg_ParseTuple(args, "i:set_autoquit", &value)) return nullptr;
  gSelf.autoquit = value;
  Py_RETURN_NONE;
}

PyObject* _tracer_set_idle_period(PyObject*, PyObject* args) {
  float value = 0;
  if (!PyArg_ParseTuple(args, "f:tracer_set_idle_period", &value)) return nullptr;
  gSelf.idle_period = value;
  if (value > 0) monitoring_lines_needed();  // the idle callback counts events
  idle_ticker_update();
  Py_RETURN_NONE;
}

PyObject* _tracer_set_debug_all_threads(PyObject*, PyObject* args) {
  int value = 0;
  if (!PyArg_ParseTuple(args, "i:set_debug_all_threads", &value)) return nullptr;
  gSelf.debug_all_threads = value;
  Py_RETURN_NONE;
}

PyObject* _tracer_set_debug_thread_cb(PyObject*, PyObject* args) {
  // The old callback goes first, even when the new arguments turn out wrong; the field is
  // then null rather than a released object.
  gSelf.debug_thread_cb.reset();
  PyObject* callback = nullptr;
  if (!PyArg_ParseTuple(args, "O:set_debug_thread_cb", &callback)) return nullptr;
  gSelf.debug_thread_cb = Ref::borrow(callback);
  // Every cached per-thread answer came from the old callback.
  CU_DeleteHashTable(&gSelf.debug_thread_map);
  CU_InitHashTable(&gSelf.debug_thread_map, sizeof(unsigned long));
  Py_RETURN_NONE;
}

PyObject* _tracer_get_threads(PyObject*, PyObject*) {
  Ref ids = Ref::steal(PyList_New(0));
  CU_HashSearch search;
  for (CU_HashEntry* e = CU_FirstHashEntry(&gSelf.thread_table, &search); ids && e != nullptr;
       e = CU_NextHashEntry(&search)) {
    auto* data = static_cast<ThreadData*>(CU_GetHashValue(e));
    Ref id = Ref::steal(id_for_tstate_ptr(data->tstate));
    if (!id || PyList_Append(ids.get(), id.get()) != 0) ids.reset();
  }
  if (!ids) {
    PyErr_Clear();
    PyErr_SetString(PyExc_MemoryError, "Out of memory");
    return nullptr;
  }
  return ids.release();
}

namespace {
// Item `index` of the argument tuple, which these methods read without a count check;
// a missing item is still an error, not a crash.
PyObject* positional(PyObject* args, Py_ssize_t index) {
  if (!PyTuple_Check(args) || PyTuple_GET_SIZE(args) <= index) {
    PyErr_SetString(PyExc_TypeError, "function takes exactly 1 argument");
    return nullptr;
  }
  return PyTuple_GET_ITEM(args, index);
}

// The record of the thread named by a tstate id; null with no error when unknown.
ThreadData* thread_data_for_id(PyObject* id) {
  PyThreadState* tstate = tstate_ptr_for_id(id);
  if (tstate == nullptr) return nullptr;
  return find_thread_data(&gSelf.thread_table, tstate);
}
}  // namespace

PyObject* _tracer_get_curr_frame(PyObject*, PyObject* args) {
  PyObject* id = positional(args, 0);
  if (id == nullptr) return nullptr;
  ThreadData* data = thread_data_for_id(id);
  if (PyErr_Occurred() != nullptr) return nullptr;
  if (data == nullptr) {
    PyErr_SetString(PyExc_IndexError, "get_curr_frame called for unknown or terminated thread");
    return nullptr;
  }
  return data->curr_frame.new_ref();
}

PyObject* _tracer_get_thread_name(PyObject*, PyObject* args) {
  PyObject* id = positional(args, 0);
  if (id == nullptr) return nullptr;
  ThreadData* data = thread_data_for_id(id);
  if (PyErr_Occurred() != nullptr) return nullptr;
  if (data == nullptr || !data->thread_name) Py_RETURN_NONE;
  return data->thread_name.new_ref();
}

PyObject* _tracer_is_botframe(PyObject*, PyObject* args) {
  PyObject* frame = positional(args, 0);
  if (frame == nullptr) return nullptr;
  ThreadData* data = get_current_thread_data(&gSelf.thread_table);
  return PyLong_FromLong(data != nullptr && data->bot_frame.is(frame) ? 1 : 0);
}

PyObject* get_tracing(PyObject*, PyObject* args) {
  if (!PyArg_ParseTuple(args, ":get_tracing")) return nullptr;
  return PyLong_FromLong(gSelf.thread_table.num_entries > 0 ? 1 : 0);
}

PyObject* _tracer_acquire_selvane_mutex(PyObject*, PyObject* args) {
  if (!PyArg_ParseTuple(args, ":acquire_selvane_mutex")) return nullptr;
  return PyLong_FromLong(acquire_selvane_mutex());
}

PyObject* _tracer_release_selvane_mutex(PyObject*, PyObject* args) {
  if (!PyArg_ParseTuple(args, ":release_selvane_mutex")) return nullptr;
  release_selvane_mutex();
  Py_RETURN_NONE;
}
