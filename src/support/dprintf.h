// dprintf.h: the debug print channel and the logging of the core's own exceptions.
//
// Every diagnostic of the core goes to one Python file object, filtered by a bit mask of
// message classes (1 function lookup, 2 code-object path names, 4 lifecycle and event flow,
// 8 breakpoint file names, 16 exception analysis, 32 waiting for input). Printing never
// disturbs the debugged program: it is not traced, keeps the pending exception, and does not
// recurse.
#pragma once

#include <Python.h>

#include <cstdarg>

extern "C" {
// Exported so that a server side or a debugger attached to the process can widen the mask.
PyAPI_DATA(unsigned int) gDPrintfMask;
// The file written to; owns one reference (managed only by set_dprintf_file). A raw pointer
// because it is an exported C global that must outlive the interpreter without a destructor.
PyAPI_DATA(PyObject*) gDPrintfFile;
}

enum DPrintfClass : unsigned int {
  kDbgLookup = 1,
  kDbgPathnames = 2,
  kDbgFlow = 4,
  kDbgBpFiles = 8,
  kDbgExceptions = 16,
  kDbgInput = 32,
};

// Releases the current file, then keeps `file` unless it is null or None (None silences).
void set_dprintf_file(PyObject* file);

void do_dprintfv(unsigned int mask, const char* format, va_list args);
// The writer behind do_dprintf, for callers that have already tested the mask.
void do_dprintf_unchecked(unsigned int mask, const char* format, ...);

// True when a message of class `mask` would be written now. Callers test it before doing
// expensive work only to build a message.
inline bool dprintf_wanted(unsigned int mask) noexcept {
  return gDPrintfFile != nullptr && (mask & gDPrintfMask) != 0;
}

// Prints a message of class `mask`. The test whether anything is written is inline: the
// dispatcher has messages on every event, and while the channel is off they must cost a
// load and a branch, not a call.
template <typename... Args>
inline void do_dprintf(unsigned int mask, const char* format, Args... args) {
  if (dprintf_wanted(mask)) do_dprintf_unchecked(mask, format, args...);
}

// Logs the pending exception (banner plus traceback) to the debug file and leaves it
// pending; the caller decides to clear it.
void DLOGEXCEPTION();

// Texts safe to pass to "%s".
const char* dprint_check_str(const char* text);
const char* dprint_check_pystr(PyObject* obj);
