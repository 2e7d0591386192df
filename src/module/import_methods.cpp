// import_methods.cpp: the record of modules loaded or reloaded since the server side last
// asked, the import callback, registering a module by hand, and the replacement __import__.
#include <Python.h>

#include "core/imports.h"
#include "core/tracercore.h"
#include "module/methods.h"
#include "support/dbgcommon.h"

PyObject* _tracer_get_new_imports(PyObject*, PyObject*) {
  // The list is handed over, not copied; a new empty one takes its place.
  return take_new_imports();
}

PyObject* _tracer_set_import_cb(PyObject*, PyObject* args) {
  // One positional argument, read by position; a wrong count or a value that could never be
  // called is refused and the callback in force stays.
  if (!PyTuple_Check(args) || PyTuple_GET_SIZE(args) != 1) {
    PyErr_SetString(PyExc_TypeError, "set_import_cb takes exactly 1 argument");
    return nullptr;
  }
  PyObject* callback = PyTuple_GET_ITEM(args, 0);
  if (callback != Py_None && !PyCallable_Check(callback)) {
    PyErr_SetString(PyExc_TypeError, "import_cb must be None or callable");
    return nullptr;
  }
  gSelf.import_cb = Ref::borrow(callback);
  Py_RETURN_NONE;
}

PyObject* _tracer_register_module(PyObject*, PyObject* args) {
  PyObject* module = nullptr;
  if (!PyArg_ParseTuple(args, "O:register_module", &module)) return nullptr;
  const char* path = register_module_direct(module);
  if (path == nullptr) {
    if (PyErr_Occurred() != nullptr) return nullptr;
    Py_RETURN_NONE;
  }
  return gPtrTo_PyUnicode_FromString(path);
}

PyObject* _tracer_import(PyObject* self, PyObject* args, PyObject* kwargs) {
  return _tracer_import_hook(self, args, kwargs);
}
