// dprintf.cpp: the debug print channel (see dprintf.h).
#include "support/dprintf.h"

#include "support/dbgcommon.h"
#include "support/pycompat.h"
#include "support/ref.h"

unsigned int gDPrintfMask = kDbgFlow | kDbgExceptions;
PyObject* gDPrintfFile = nullptr;

void set_dprintf_file(PyObject* file) {
  PyObject* old = gDPrintfFile;
  gDPrintfFile = nullptr;
  Py_XDECREF(old);
  if (file != nullptr && file != Py_None) {
    Py_INCREF(file);
    gDPrintfFile = file;
  }
}

void do_dprintf_unchecked(unsigned int mask, const char* format, ...) {
  va_list args;
  va_start(args, format);
  do_dprintfv(mask, format, args);
  va_end(args);
}

namespace {

// The thread may print when it has a state and is not already two levels deep in tracing
// (a write that triggers another write stops there).
PyThreadState* thread_allowed_to_print() {
  PyThreadState* ts = compat::current_tstate();
  if (ts == nullptr || compat::tracing_get(ts) >= 2) return nullptr;
  return ts;
}

Ref format_message(const char* format, va_list args) {
  if (gPtrTo_PyUnicode_FormatV == nullptr) {
    return Ref::steal(
        gPtrTo_PyUnicode_FromString("DPRINTF error:  gPtrTo_PyUnicode_FormatV is NULL\n"));
  }
  Ref message = Ref::steal(gPtrTo_PyUnicode_FormatV(format, args));
  if (!message) {
    PyErr_Clear();
    message =
        Ref::steal(gPtrTo_PyUnicode_FromString("DPRINTF error: unable to create output string\n"));
  }
  return message;
}

// Both steps run whatever happens to the other; their failures are dropped by the caller.
void write_and_flush(PyObject* file, PyObject* message) {
  if (message != nullptr && PyFile_WriteObject(message, file, Py_PRINT_RAW) != 0) PyErr_Clear();
  Ref flushed = Ref::steal(PyObject_CallMethod(file, "flush", nullptr));
  if (!flushed) PyErr_Clear();
}

}  // namespace

void do_dprintfv(unsigned int mask, const char* format, va_list args) {
  if (!dprintf_wanted(mask)) return;
  PyThreadState* ts = thread_allowed_to_print();
  if (ts == nullptr) return;
  compat::tracing_add(ts, 1);
  compat::PendingError saved;
  saved.fetch();
  {
    // Hold the file: the write may run code that replaces it.
    Ref file = Ref::borrow(gDPrintfFile);
    Ref message = format_message(format, args);
    write_and_flush(file.get(), message.get());
  }
  saved.restore();  // also discards whatever the write or flush raised
  compat::tracing_add(ts, -1);
}

void DLOGEXCEPTION() {
  if (gDPrintfFile == nullptr || PyErr_Occurred() == nullptr) return;
  PyThreadState* ts = thread_allowed_to_print();
  if (ts == nullptr) return;
  compat::tracing_add(ts, 1);
  compat::PendingError failure;
  failure.fetch();
  do_dprintf(kDbgFlow, "EXCEPTION IN DEBUG TRACER:\n");
  Ref saved_stderr = Ref::borrow(PySys_GetObject("stderr"));
  if (saved_stderr && !saved_stderr.is_none()) {
    Ref file = Ref::borrow(gDPrintfFile);
    if (PySys_SetObject("stderr", file.get()) == 0) {
      failure.display();
      PySys_SetObject("stderr", saved_stderr.get());
    }
    PyErr_Clear();
  }
  failure.restore();
  compat::tracing_add(ts, -1);
}

const char* dprint_check_str(const char* text) {
  if (text == nullptr) return "(NULL)";
  if (gDPrintfFile == nullptr) return text;
  for (const unsigned char* p = reinterpret_cast<const unsigned char*>(text); *p; ++p) {
    if (*p >= 0x80) return "(non-ascii string)";
  }
  return text;
}

const char* dprint_check_pystr(PyObject* obj) {
  if (obj == nullptr) return "(NULL PyObject*)";
  if (!PyUnicode_Check(obj)) return "(non-PyString PyObject*)";
  const char* text = PyUnicode_AsUTF8(obj);
  if (text == nullptr) {
    PyErr_Clear();
    return "(NULL)";
  }
  return dprint_check_str(text);
}
