// bpops.h: breakpoint records, their tables and the changed-breakpoint lists.
//
// The tables land with the breakpoint work; until then the record only counts the unique
// imports that stop_trace reports, and its init and clear functions keep that count.
#pragma once

#include <Python.h>

struct COPathnameTable;

struct BpOpsData {
  int unique_import_count = 0;  // modules registered by the import hook
};

void __tracer_init_bp_ops_data(BpOpsData* data, COPathnameTable* co_pathname_table);
void __tracer_clear_bp_ops_data(BpOpsData* data, COPathnameTable* co_pathname_table);

// New 2-tuple (ids of deleted breakpoints, tuples of the other changed breakpoints); the
// changed list is emptied. Null with MemoryError set when it cannot be made.
PyObject* __tracer_get_changed_bps_lists(BpOpsData* data);
