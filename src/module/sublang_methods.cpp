// sublang_methods.cpp: registering sub-language hooks and asking which hook is active in a
// thread and what a frame is to it.
#include <Python.h>

#include "core/monitoring.h"
#include "core/sublang.h"
#include "core/tracercore.h"
#include "module/methods.h"
#include "threads/threadops.h"

namespace {
// The record of the thread named by a tstate id; null when unknown, or with an error set
// when the id is not an int.
ThreadData* thread_data_for_id(PyObject* id) {
  PyThreadState* tstate = tstate_ptr_for_id(id);
  if (tstate == nullptr) return nullptr;
  return find_thread_data(&gSelf.thread_table, tstate);
}
}  // namespace

PyObject* _tracer_register_sub_language_hook(PyObject*, PyObject* args) {
  PyObject* hook = nullptr;
  if (!PyArg_ParseTuple(args, "O:register_sub_language_hook", &hook)) return nullptr;
  if (__tracer_register_sub_language_hook(hook) != 0) return nullptr;
  monitoring_lines_needed();  // the hook decides at its own lines
  Py_RETURN_NONE;
}

// The two queries read their arguments by position in the original design, which lets a
// short tuple read past its end: they are parsed, and a wrong count or type is a TypeError.
PyObject* _tracer_sub_language_get_active_hook(PyObject*, PyObject* args) {
  PyObject* id = nullptr;
  if (!PyArg_ParseTuple(args, "O:sub_language_get_active_hook", &id)) return nullptr;
  ThreadData* data = thread_data_for_id(id);
  if (PyErr_Occurred() != nullptr) return nullptr;
  if (!gSelf.sub_language.enabled || data == nullptr || !data->sub_language_hook) Py_RETURN_NONE;
  return data->sub_language_hook.new_ref();
}

PyObject* _tracer_sub_language_get_frame_category(PyObject*, PyObject* args) {
  PyObject* id = nullptr;
  PyObject* frame = nullptr;
  if (!PyArg_ParseTuple(args, "OO:sub_language_get_frame_category", &id, &frame)) return nullptr;
  ThreadData* data = thread_data_for_id(id);
  if (PyErr_Occurred() != nullptr) return nullptr;
  // The implementation test may run the hook's own code, which may reset the core.
  PinnedThreadData pin(data);
  return PyLong_FromLong(__tracer_sub_language_get_frame_category(data, frame));
}
