// catchinfo.cpp: the functions known to catch exceptions and print them (see exceptops.h).
//
// Such a function handles an exception in the byte code's eyes, while for the user it is as
// good as unhandled: in exception modes 4 and 5 the core stops where the list says that the
// frame's function (or its caller) prints what it catches. The index is keyed by function
// name; each name holds its instances in the order given.
#include <cstring>

#include "exc/exceptops.h"
#include "names/containing_class.h"
#include "support/dbgcommon.h"
#include "support/dprintf.h"
#include "support/pycompat.h"

namespace {

// The attribute name, made on first use and kept; null when it cannot be made.
PyObject* cached_name(Ref& cache, const char* name) {
  if (!cache) cache = Ref::steal(gPtrTo_PyUnicode_FromString(name));
  return cache.get();
}

Ref get_attrib(PyObject* object, Ref& cache, const char* name) {
  PyObject* key = cached_name(cache, name);
  return key != nullptr ? Ref::steal(PyObject_GetAttr(object, key)) : Ref();
}

// The truth value of an attribute: 1, 0, or -1 when it cannot be read.
int get_boolean_attrib(PyObject* object, Ref& cache, const char* name) {
  Ref value = get_attrib(object, cache, name);
  return value ? PyObject_IsTrue(value.get()) : -1;
}

int get_prints_and_parent(ExcData* data, PyObject* instance, int* prints, int* parent) {
  *prints = get_boolean_attrib(instance, data->prints_str, "prints");
  if (*prints < 0) return -1;
  *parent = get_boolean_attrib(instance, data->parent_str, "parent");
  return *parent < 0 ? -1 : 0;
}

Ref frame_code(PyObject* frame) {
  return Ref::steal(
      reinterpret_cast<PyObject*>(PyFrame_GetCode(reinterpret_cast<PyFrameObject*>(frame))));
}

// 1 when the instance describes the frame's function, 0 when not, -1 on failure (which ends
// the whole search).
int instance_matches(ExcData* data, PyObject* instance, PyObject* frame) {
  Ref mod_name = get_attrib(instance, data->mod_name_str, "mod_name");
  if (!mod_name) return -1;
  int module = mod_name_matches(data, mod_name.get(), frame);
  if (module <= 0) return module;
  do_dprintf(kDbgExceptions, "  match1\n");
  return containing_class_matches(data, instance, frame);
}

}  // namespace

int set_catch_info_list(ExcData* data, PyObject* list) {
  data->catch_info.reset();
  if (!PyList_Check(list)) return 0;
  Py_ssize_t length = PyList_Size(list);
  if (length <= 0) return length < 0 ? -1 : 0;
  data->catch_info = Ref::steal(PyDict_New());
  if (!data->catch_info) return -1;
  // Held: reading an instance's attribute can run code that replaces the index.
  Ref index = data->catch_info;
  for (Py_ssize_t i = 0; i < PyList_Size(list); ++i) {
    Ref instance = Ref::borrow(PyList_GetItem(list, i));
    if (!instance) return PyErr_Occurred() != nullptr ? -1 : 0;
    Ref name = get_attrib(instance.get(), data->co_name_str, "co_name");
    if (!name) return -1;
    PyObject* entries = PyDict_GetItemWithError(index.get(), name.get());  // borrowed
    if (entries == nullptr) {
      if (PyErr_Occurred() != nullptr) return -1;
      Ref fresh = Ref::steal(PyList_New(0));
      if (!fresh || PyDict_SetItem(index.get(), name.get(), fresh.get()) != 0) return -1;
      entries = fresh.get();  // now also held by the index
    }
    if (PyList_Append(entries, instance.get()) != 0) return -1;
  }
  return 0;
}

PyObject* find_catch_info(ExcData* data, PyObject* frame) {
  do_dprintf(kDbgExceptions, "find_catch_info\n");
  if (!data->catch_info || !compat::is_plain_frame(frame)) {
    do_dprintf(kDbgExceptions, "  null dict or not frame\n");
    return nullptr;
  }
  Ref index = data->catch_info;
  Ref code = frame_code(frame);
  PyObject* name = reinterpret_cast<PyCodeObject*>(code.get())->co_name;
  Ref entries = Ref::borrow(PyDict_GetItemWithError(index.get(), name));
  if (!entries) {
    PyErr_Clear();
    do_dprintf(kDbgExceptions, "  null info_list; looking for %s\n", dprint_check_pystr(name));
    return nullptr;
  }
  int matched = PyList_Check(entries.get()) ? 0 : -1;
  if (matched < 0) do_dprintf(kDbgExceptions, "  not list\n");
  Ref found;
  for (Py_ssize_t i = 0; matched == 0 && i < PyList_GET_SIZE(entries.get()); ++i) {
    Ref instance = Ref::borrow(PyList_GET_ITEM(entries.get(), i));
    matched = instance_matches(data, instance.get(), frame);
    if (matched > 0) {
      do_dprintf(kDbgExceptions, "  match2\n");
      found = instance;
    }
  }
  if (matched < 0) {
    do_dprintf(kDbgExceptions, "  failure\n");
    PyErr_Clear();
    return nullptr;
  }
  return found.release();
}

int mod_name_matches(ExcData* data, PyObject* mod_name, PyObject* frame) {
  if (mod_name == nullptr || !PyUnicode_Check(mod_name) || !compat::is_plain_frame(frame)) {
    return 0;
  }
  const char* wanted = _pystring_to_c_string(mod_name);
  if (wanted == nullptr) return -1;
  if (std::strcmp(wanted, "*") == 0) return 1;
  PyObject* key = cached_name(data->dunder_name_str, "__name__");
  if (key == nullptr) return -1;
  Ref globals = Ref::steal(PyFrame_GetGlobals(reinterpret_cast<PyFrameObject*>(frame)));
  Ref name = Ref::borrow(PyDict_GetItemWithError(globals.get(), key));
  if (!name || !PyUnicode_Check(name.get())) {
    PyErr_Clear();
    return 0;
  }
  const char* actual = _pystring_to_c_string(name.get());
  if (actual == nullptr) return -1;
  return std::strcmp(wanted, actual) == 0 ? 1 : 0;
}

int containing_class_matches(ExcData* data, PyObject* instance, PyObject* frame) {
  Ref wanted_obj = get_attrib(instance, data->containing_class_str, "containing_class");
  // A missing or non-string class name is a failure, unlike a non-string module name: the
  // two were always told apart this way.
  const char* wanted =
      wanted_obj && PyUnicode_Check(wanted_obj.get()) && compat::is_plain_frame(frame)
          ? _pystring_to_c_string(wanted_obj.get())
          : nullptr;
  if (wanted == nullptr) return -1;
  if (std::strcmp(wanted, "*") == 0) return 1;
  Ref code = frame_code(frame);
  Ref globals = Ref::steal(PyFrame_GetGlobals(reinterpret_cast<PyFrameObject*>(frame)));
  Ref cls = Ref::steal(GetContainingClass(code.get(), globals.get()));
  if (!cls) return -1;
  if (cls.is_none()) return 0;
  const char* actual = GetPyClassName(cls.get());
  return actual != nullptr && std::strcmp(actual, wanted) == 0 ? 1 : 0;
}

int frame_prints_exc(ExcData* data, PyObject* frame) {
  Ref instance = Ref::steal(find_catch_info(data, frame));
  do_dprintf(kDbgExceptions, "frame_prints_exc");
  if (!instance) {
    do_dprintf(kDbgExceptions, "catch_info == NULL\n");
    return 0;
  }
  int prints = 0, parent = 0;
  if (get_prints_and_parent(data, instance.get(), &prints, &parent) != 0) {
    do_dprintf(kDbgExceptions, "get_prints_and_parent failed\n");
    PyErr_Clear();
    return 0;
  }
  do_dprintf(kDbgExceptions, "prints=%i, parent=%i\n", prints, parent);
  return prints && !parent ? 1 : 0;
}

int parent_frame_prints_exc(ExcData* data, PyObject* frame) {
  Ref instance = Ref::steal(find_catch_info(data, frame));
  if (!instance) return 0;
  int prints = 0, parent = 0;
  if (get_prints_and_parent(data, instance.get(), &prints, &parent) != 0) {
    PyErr_Clear();
    return 0;
  }
  return prints && parent ? 1 : 0;
}
