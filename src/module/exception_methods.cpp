// exception_methods.cpp: the lists of exception types on which to stop always or never.
// A stored list is never an empty tuple: an empty one clears the field.
#include <Python.h>

#include "core/tracercore.h"
#include "module/methods.h"

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
