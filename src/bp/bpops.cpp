// bpops.cpp: breakpoint tables (see bpops.h).
#include "bp/bpops.h"

void __tracer_init_bp_ops_data(BpOpsData* data, COPathnameTable*) {
  data->unique_import_count = 0;
}

void __tracer_clear_bp_ops_data(BpOpsData* data, COPathnameTable*) {
  data->unique_import_count = 0;
}

PyObject* __tracer_get_changed_bps_lists(BpOpsData*) {
  PyObject* lists = Py_BuildValue("([][])");
  if (lists == nullptr) {
    PyErr_Clear();
    PyErr_SetString(PyExc_MemoryError, "Out of memory");
  }
  return lists;
}
