// usercode.cpp: telling the program's own code from library code by file name prefixes.
#include "exc/usercode.h"

#include <frameobject.h>

#include "support/pycompat.h"

namespace {

bool has_prefix(PyObject* text, PyObject* prefix) {
  Py_ssize_t found = PyUnicode_Tailmatch(text, prefix, 0, PY_SSIZE_T_MAX, -1);
  if (found < 0) PyErr_Clear();
  return found == 1;
}

bool is_frozen_module_name(PyObject* filename) {
  static constexpr char kFrozen[] = "<frozen ";
  Ref prefix = Ref::steal(PyUnicode_FromString(kFrozen));
  if (!prefix) {
    PyErr_Clear();
    return false;
  }
  return has_prefix(filename, prefix.get());
}

}  // namespace

int set_library_prefixes(UserCode* user_code, PyObject* prefixes) {
  if (PyUnicode_Check(prefixes)) {
    PyErr_SetString(PyExc_TypeError, "library prefixes must be a sequence of str, not a str");
    return -1;
  }
  Ref items = Ref::steal(PySequence_Tuple(prefixes));
  if (!items) {
    if (PyErr_ExceptionMatches(PyExc_TypeError)) {
      PyErr_Format(PyExc_TypeError, "library prefixes must be a sequence of str, not %.100s",
                   Py_TYPE(prefixes)->tp_name);
    }
    return -1;
  }
  for (Py_ssize_t i = 0; i < PyTuple_GET_SIZE(items.get()); ++i) {
    PyObject* item = PyTuple_GET_ITEM(items.get(), i);
    if (!PyUnicode_Check(item) || PyUnicode_GetLength(item) == 0) {
      PyErr_Format(PyExc_TypeError, "library prefix %zd must be a non-empty str, not %.100s", i,
                   Py_TYPE(item)->tp_name);
      return -1;
    }
  }
  user_code->library_prefixes = std::move(items);
  return 0;
}

PyObject* library_prefixes(const UserCode* user_code) {
  if (user_code->library_prefixes) return user_code->library_prefixes.new_ref();

  return PyTuple_New(0);
}

bool frame_is_library_code(const UserCode* user_code, PyObject* frame) {
  if (frame == nullptr || !compat::is_plain_frame(frame)) return false;
  Ref code = Ref::steal(
      reinterpret_cast<PyObject*>(PyFrame_GetCode(reinterpret_cast<PyFrameObject*>(frame))));
  if (!code) return false;
  PyObject* filename = reinterpret_cast<PyCodeObject*>(code.get())->co_filename;
  PyObject* prefixes = user_code->library_prefixes.get();
  if (filename == nullptr || !PyUnicode_Check(filename) || prefixes == nullptr ||
      PyTuple_GET_SIZE(prefixes) == 0)
    return false;
  if (is_frozen_module_name(filename)) return true;
  for (Py_ssize_t i = 0; i < PyTuple_GET_SIZE(prefixes); ++i) {
    if (has_prefix(filename, PyTuple_GET_ITEM(prefixes, i))) return true;
  }
  return false;
}
