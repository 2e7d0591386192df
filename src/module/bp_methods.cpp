// bp_methods.cpp: the breakpoint methods. Each parses its arguments with the format whose
// text after the colon names the method in argument errors, and calls the breakpoint table.
#include <Python.h>

#include "bp/bpops.h"
#include "core/monitoring.h"
#include "core/tracercore.h"
#include "module/methods.h"
#include "support/dprintf.h"

namespace {
BpOpsData* breakpoints() {
  return &gSelf.bp_ops_data;
}

// set_breaks_cond takes text or None; anything else is refused with a clear error before any
// breakpoint's condition is dropped.
bool check_condition(PyObject* cond) {
  if (cond == Py_None || PyUnicode_Check(cond)) return true;
  PyErr_SetString(PyExc_TypeError, "cond must be a string or None");
  return false;
}
}  // namespace

PyObject* _tracer_set_break(PyObject*, PyObject* args) {
  const char* file = nullptr;
  int lineno = 0, enabled = 0, temporary = 0, ignore_count = 0;
  PyObject* cond = nullptr;
  if (!PyArg_ParseTuple(args, "siiiOi:tracer_set_break", &file, &lineno, &enabled, &temporary,
                        &cond, &ignore_count)) {
    return nullptr;
  }
  // A condition that is not text fails as any record that cannot be made does (MemoryError
  // "Out of memory", the id used up): set_break's callers have always relied on that.
  do_dprintf(kDbgFlow, "SETTING BREAK\n");
  do_dprintf(kDbgFlow, "  line = %d, filename = %s\n", lineno, dprint_check_str(file));
  int id = __tracer_set_break(breakpoints(), file, lineno, enabled, temporary, cond, ignore_count);
  if (id == -1) return nullptr;  // MemoryError "Out of memory" is set
  monitoring_lines_needed();     // its line may have gone quiet
  return PyLong_FromLong(id);
}

PyObject* _tracer_clear_breaks(PyObject*, PyObject* args) {
  const char* file = nullptr;
  int lineno = 0;
  if (!PyArg_ParseTuple(args, "si:tracer_clear_breaks", &file, &lineno)) return nullptr;
  __tracer_clear_breaks(breakpoints(), file, lineno);
  Py_RETURN_NONE;
}

PyObject* _tracer_enable_breaks(PyObject*, PyObject* args) {
  const char* file = nullptr;
  int lineno = 0, flag = 0;
  if (!PyArg_ParseTuple(args, "sii:tracer_enable_breaks", &file, &lineno, &flag)) return nullptr;
  __tracer_enable_breaks(breakpoints(), file, lineno, flag);
  Py_RETURN_NONE;
}

PyObject* _tracer_ignore_breaks(PyObject*, PyObject* args) {
  const char* file = nullptr;
  int lineno = 0, count = 0;
  if (!PyArg_ParseTuple(args, "sii:tracer_ignore_breaks", &file, &lineno, &count)) return nullptr;
  __tracer_ignore_breaks(breakpoints(), file, lineno, count);
  Py_RETURN_NONE;
}

PyObject* _tracer_set_breaks_cond(PyObject*, PyObject* args) {
  const char* file = nullptr;
  int lineno = 0;
  PyObject* cond = nullptr;
  if (!PyArg_ParseTuple(args, "siO:tracer_set_breaks_cond", &file, &lineno, &cond)) {
    return nullptr;
  }
  if (!check_condition(cond)) return nullptr;
  if (__tracer_set_breaks_cond(breakpoints(), file, lineno, cond) < 0) return nullptr;
  Py_RETURN_NONE;
}

PyObject* _tracer_clear_all_breaks(PyObject*, PyObject*) {
  __tracer_clear_all_breaks(breakpoints());
  Py_RETURN_NONE;
}

PyObject* _tracer_get_breaks(PyObject*, PyObject* args) {
  const char* file = nullptr;
  int lineno = 0;
  if (!PyArg_ParseTuple(args, "si:tracer_get_breaks", &file, &lineno)) return nullptr;
  return __tracer_get_breaks(breakpoints(), file, lineno);
}

PyObject* _tracer_get_file_breaks(PyObject*, PyObject* args) {
  const char* file = nullptr;
  if (!PyArg_ParseTuple(args, "s:tracer_get_file_breaks", &file)) return nullptr;
  return __tracer_get_file_breaks(breakpoints(), file);
}

PyObject* get_changed_bps_lists(PyObject*, PyObject* args) {
  if (!PyArg_ParseTuple(args, ":get_changed_bps_lists")) return nullptr;
  return __tracer_get_changed_bps_lists(breakpoints());
}
