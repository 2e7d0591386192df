// dbgcommon.cpp: interpreter call helpers (see dbgcommon.h).
#include "support/dbgcommon.h"

#include <dlfcn.h>

#include <cstdio>
#include <cstring>

#include "support/dprintf.h"
#include "support/pycompat.h"

PyObject* (*gPtrTo_PyUnicode_FromString)(const char*) = nullptr;
PyObject* (*gPtrTo_PyUnicode_FormatV)(const char*, va_list) = nullptr;

void* lookup_python_function(const char* name) {
  // ELF symbols carry no leading underscore; the name is still bounded like any symbol.
  char symbol[512];
  int written = snprintf(symbol, sizeof symbol, "%s", name);
  if (written < 0 || static_cast<size_t>(written) >= sizeof symbol) return nullptr;
  return dlsym(RTLD_DEFAULT, symbol);
}

PyObject* get_module_fct(const char* module_name, const char* fct_name) {
  Ref module = Ref::steal(PyImport_ImportModule(module_name));
  if (!module) {
    do_dprintf(kDbgLookup, "module %s not found\n", dprint_check_str(module_name));
    return nullptr;
  }
  Ref fct = Ref::steal(PyObject_GetAttrString(module.get(), fct_name));
  if (!fct) {
    do_dprintf(kDbgLookup, "%s.%s function not found\n", dprint_check_str(module_name),
               dprint_check_str(fct_name));
    return nullptr;
  }
  if (!PyCallable_Check(fct.get())) {
    do_dprintf(kDbgLookup, "%s.%s is not callable\n", dprint_check_str(module_name),
               dprint_check_str(fct_name));
    return nullptr;
  }
  return fct.release();
}

PyObject* do_one_arg_call(PyObject* callable, PyObject* arg1) {
  Ref args = Ref::steal(PyTuple_Pack(1, arg1));
  if (!args) return nullptr;
  return PyObject_CallObject(callable, args.get());
}

PyObject* do_two_arg_call(PyObject* callable, PyObject* arg1, PyObject* arg2) {
  Ref args = Ref::steal(PyTuple_Pack(2, arg1, arg2));
  if (!args) return nullptr;
  return PyObject_CallObject(callable, args.get());
}

PyObject* do_three_arg_call(PyObject* callable, PyObject* arg1, PyObject* arg2, PyObject* arg3) {
  Ref args = Ref::steal(PyTuple_Pack(3, arg1, arg2, arg3));
  if (!args) return nullptr;
  return PyObject_CallObject(callable, args.get());
}

Ref frame_back(PyObject* frame) {
  // Current interpreters have one frame type; there are no C frames to step over.
  if (frame == nullptr || !compat::is_plain_frame(frame)) return Ref();
  return compat::frame_back(reinterpret_cast<PyFrameObject*>(frame));
}

int get_stack_depth(PyThreadState* tstate) {
  if (tstate == nullptr) tstate = compat::current_tstate();
  if (tstate == nullptr) return 0;
  int depth = 0;
  for (Ref frame = compat::tstate_frame(tstate); frame; frame = frame_back(frame.get())) ++depth;
  return depth;
}

const char* _pystring_to_c_string(PyObject* str) {
  const char* text = str != nullptr && PyUnicode_Check(str) ? PyUnicode_AsUTF8(str) : nullptr;
  if (text == nullptr) {
    PyErr_Clear();
    do_dprintf(kDbgPathnames, "FAILURE: Could not convert unicode to UTF-8: %s",
               dprint_check_pystr(str));
  }
  return text;
}

char* _pystring_to_c_string_copy(PyObject* str) {
  const char* text = _pystring_to_c_string(str);
  if (text == nullptr) return nullptr;
  char* copy = strdup(text);
  if (copy == nullptr) {
    do_dprintf(kDbgPathnames, "FAILURE: Out of memory copying string: %s", dprint_check_pystr(str));
    PyErr_Clear();
  }
  return copy;
}
