// containing_class.cpp: the class whose body defines a frame's function (see
// containing_class.h). The walks run no Python code, so the dictionaries are walked in place.
#include "names/containing_class.h"

namespace {
bool is_class(PyObject* object) {
  return PyType_Check(object);  // its type carries the type-subclass flag
}
}  // namespace

PyObject* GetContainingClass(PyObject* code, PyObject* globals) {
  return ScanForContainingClass(globals, code, 0);
}

PyObject* ScanForContainingClass(PyObject* dict, PyObject* code, int /*depth*/) {
  if (dict != nullptr && PyDict_Check(dict)) {
    Py_ssize_t pos = 0;
    PyObject *key, *value;
    while (PyDict_Next(dict, &pos, &key, &value)) {
      if (!is_class(value)) continue;
      PyObject* found = FindInSingleClass(value, code);
      if (found == nullptr || found != Py_None) return found;
      Py_DECREF(found);
    }
  }
  Py_RETURN_NONE;
}

PyObject* FindInSingleClass(PyObject* cls, PyObject* code) {
  if (is_class(cls)) {
    // The class's own namespace: its type dictionary, read without a lookup.
    PyObject* dict = reinterpret_cast<PyTypeObject*>(cls)->tp_dict;
    Py_ssize_t pos = 0;
    PyObject *key, *value;
    while (dict != nullptr && PyDict_Next(dict, &pos, &key, &value)) {
      if (Py_IS_TYPE(value, &PyFunction_Type) && PyFunction_GET_CODE(value) == code) {
        return Py_NewRef(cls);
      }
    }
  }
  Py_RETURN_NONE;
}

const char* GetPyClassName(PyObject* object) {
  return is_class(object) ? reinterpret_cast<PyTypeObject*>(object)->tp_name : nullptr;
}
