// exception_methods.cpp: the settings of the exception decision: the lists of exception
// types on which to stop always or never (a stored list is never an empty tuple: an empty one
// clears the field), the exception mode, the locations not to stop at again, the handlers to
// disregard and the functions known to print what they catch.
#include <Python.h>

#include "core/tracercore.h"
#include "exc/exceptops.h"
#include "module/methods.h"
#include "threads/threadops.h"

namespace {

PyObject* set_stop_list(Ref& field, PyObject* args, const char* format) {
  PyObject* types = nullptr;
  if (!PyArg_ParseTuple(args, format, &PyTuple_Type, &types)) return nullptr;
  field.reset();
  if (PyTuple_GET_SIZE(types) > 0) field = Ref::borrow(types);
  Py_RETURN_NONE;
}

PyObject* get_stop_list(const Ref& field, PyObject* args, const char* format) {
  if (!PyArg_ParseTuple(args, format)) return nullptr;
  if (field) return field.new_ref();
  return PyTuple_New(0);
}

}  // namespace

PyObject* set_always_stop_excepts(PyObject*, PyObject* args) {
  return set_stop_list(gSelf.always_stop_excepts, args, "O!:set_always_stop_excepts");
}

PyObject* get_always_stop_excepts(PyObject*, PyObject* args) {
  return get_stop_list(gSelf.always_stop_excepts, args, ":get_always_stop_excepts");
}

PyObject* set_never_stop_excepts(PyObject*, PyObject* args) {
  return set_stop_list(gSelf.never_stop_excepts, args, "O!:set_never_stop_excepts");
}

PyObject* get_never_stop_excepts(PyObject*, PyObject* args) {
  return get_stop_list(gSelf.never_stop_excepts, args, ":get_never_stop_excepts");
}

// ---- Exception mode, location filters, ignored handlers, catch-info list ----------------------

PyObject* _tracer_set_exception_mode(PyObject*, PyObject* args) {
  int mode = 0;
  if (!PyArg_ParseTuple(args, "i:tracer_set_exception_mode", &mode)) return nullptr;
  gSelf.exception_mode = mode;  // unchecked: unknown modes behave as never-stop
  Py_RETURN_NONE;
}

PyObject* _tracer_get_exception_mode(PyObject*, PyObject*) {
  return PyLong_FromLong(gSelf.exception_mode);
}

namespace {
// A location is an int line number or a tuple of two ints; anything else is refused before
// the filters change.
bool check_location(PyObject* loc) {
  _get_exc_ignore_hash_number(loc);
  return PyErr_Occurred() == nullptr;
}
}  // namespace

PyObject* _tracer_ignore_exception_loc(PyObject*, PyObject* args) {
  const char* filename = nullptr;
  PyObject* loc = nullptr;
  int ignore = 0;
  if (!PyArg_ParseTuple(args, "sOi:tracer_ignore_exception_loc", &filename, &loc, &ignore) ||
      !check_location(loc)) {
    return nullptr;
  }
  if (!ignore) {
    __tracer_del_exc_filter(&gSelf.exc_filters, filename, loc);
    Py_RETURN_NONE;
  }
  if (__tracer_add_exc_filter(&gSelf.exc_filters, gSelf.file_ops_data, filename, loc) == nullptr) {
    PyErr_Clear();
    PyErr_SetString(PyExc_MemoryError, "Out of memory");
    return nullptr;
  }
  Py_RETURN_NONE;
}

PyObject* _tracer_exception_loc_ignored(PyObject*, PyObject* args) {
  const char* filename = nullptr;
  PyObject* loc = nullptr;
  if (!PyArg_ParseTuple(args, "sO:tracer_exception_loc_ignored", &filename, &loc) ||
      !check_location(loc)) {
    return nullptr;
  }
  bool found =
      __tracer_exc_filtered(&gSelf.exc_filters, gSelf.file_ops_data, filename, loc) != nullptr;
  return PyLong_FromLong(found ? 1 : 0);
}

PyObject* _tracer_clear_exception_ignores(PyObject*, PyObject*) {
  __tracer_clear_exception_filters(&gSelf.exc_filters);
  Py_RETURN_NONE;
}

PyObject* _tracer_exiting_on_exception(PyObject*, PyObject*) {
  ThreadData* data = get_current_thread_data(&gSelf.thread_table);
  bool exiting = gSelf.autoquit && data != nullptr && data->leaving_bot_frame;
  return PyLong_FromLong(exiting ? 1 : 0);
}

PyObject* set_ignored_exception_handlers(PyObject*, PyObject* args) {
  PyObject* handlers = nullptr;
  if (!PyArg_ParseTuple(args, "O:set_ignored_exception_handlers", &handlers)) return nullptr;
  gSelf.ignored_exception_handlers = Ref::borrow(handlers);
  Py_RETURN_NONE;
}

PyObject* set_exc_catch_info_list(PyObject*, PyObject* args) {
  PyObject* list = nullptr;
  if (!PyArg_ParseTuple(args, "O!:set_exc_catch_info_list", &PyList_Type, &list)) return nullptr;
  if (set_catch_info_list(&gSelf.exc_data, list) != 0) return nullptr;
  Py_RETURN_NONE;
}
