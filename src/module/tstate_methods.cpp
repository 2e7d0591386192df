// tstate_methods.cpp: thread-state and frame utilities for the server side: the tracing
// counter and switch of the calling thread, tstate ids, frame files and writing edited
// locals back into a frame.
#include <Python.h>

#include <climits>

#include "core/tracercore.h"
#include "module/methods.h"
#include "names/conames.h"
#include "support/dbgcommon.h"
#include "support/pycompat.h"
#include "threads/threadops.h"

PyObject* locals_to_fast(PyObject*, PyObject* args) {
  PyObject* frame = nullptr;
  if (!PyArg_ParseTuple(args, "O!:locals_to_fast", &PyFrame_Type, &frame)) return nullptr;
  compat::locals_to_fast(reinterpret_cast<PyFrameObject*>(frame), 0);
  Py_RETURN_NONE;
}

PyObject* wrap_PyFrame_LocalsToFast(PyObject*, PyObject* args) {
  PyObject* frame = nullptr;
  int clear = 0;
  if (!PyArg_ParseTuple(args, "O!i:PyFrame_LocalsToFast", &PyFrame_Type, &frame, &clear)) {
    return nullptr;
  }
  compat::locals_to_fast(reinterpret_cast<PyFrameObject*>(frame), clear);
  Py_RETURN_NONE;
}

PyObject* get_frame_file(PyObject*, PyObject* args) {
  PyObject* frame = nullptr;
  if (!PyArg_ParseTuple(args, "O!:get_frame_file", &PyFrame_Type, &frame)) return nullptr;
  const char* path = __tracer_get_full_path(&gSelf.co_pathname_table, frame);
  if (path == nullptr) {
    if (PyErr_Occurred() != nullptr) return nullptr;
    Py_RETURN_NONE;
  }
  return gPtrTo_PyUnicode_FromString(path);
}

PyObject* get_current_tstate_id(PyObject*, PyObject* args) {
  if (!PyArg_ParseTuple(args, ":get_current_tstate_id")) return nullptr;
  return id_for_tstate_ptr(compat::current_tstate());
}

PyObject* get_thread_ident_for_tstate_id(PyObject*, PyObject* args) {
  PyObject* id = nullptr;
  if (!PyArg_ParseTuple(args, "O:get_thread_ident_for_tstate_id", &id)) return nullptr;
  PyThreadState* tstate = tstate_ptr_for_id(id);
  if (tstate == nullptr && PyErr_Occurred() != nullptr) return nullptr;
  ThreadData* data = find_thread_data(&gSelf.thread_table, tstate);
  if (data == nullptr) Py_RETURN_NONE;
  return PyLong_FromUnsignedLong(data->thread_id);
}

PyObject* add_to_tstate_tracing(PyObject*, PyObject* args) {
  int delta = 0;
  if (!PyArg_ParseTuple(args, "i:add_to_tstate_tracing", &delta)) return nullptr;
  PyThreadState* ts = compat::current_tstate();
  // A negative counter breaks the interpreter's own bookkeeping of trace calls (a debug
  // build aborts on it): the value may be negative, the counter may not become so.
  long result = static_cast<long>(compat::tracing_get(ts)) + delta;
  if (result < 0 || result > INT_MAX / 2) {
    PyErr_Format(PyExc_ValueError, "tracing counter would become %ld", result);
    return nullptr;
  }
  compat::tracing_add(ts, delta);
  Py_RETURN_NONE;
}

PyObject* get_tstate_tracing(PyObject*, PyObject* args) {
  if (!PyArg_ParseTuple(args, ":get_tstate_tracing")) return nullptr;
  return PyLong_FromLong(compat::tracing_get(compat::current_tstate()));
}

PyObject* set_tstate_use_tracing(PyObject*, PyObject* args) {
  int value = 0;
  if (!PyArg_ParseTuple(args, "i:set_tstate_use_tracing", &value)) return nullptr;
  if (!compat::use_tracing_set(compat::current_tstate(), value)) {
    PyErr_SetString(PyExc_MemoryError, "Out of memory");
    return nullptr;
  }
  Py_RETURN_NONE;
}

PyObject* get_tstate_use_tracing(PyObject*, PyObject* args) {
  if (!PyArg_ParseTuple(args, ":get_tstate_use_tracing")) return nullptr;
  return PyLong_FromLong(compat::use_tracing_get(compat::current_tstate()));
}
