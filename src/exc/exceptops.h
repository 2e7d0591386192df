// exceptops.h: what the exception decision knows besides the byte code: the locations where
// the user asked not to stop again, the exception records kept per frame while an exception
// passes through it, and the list of functions known to catch and print exceptions.
#pragma once

#include <Python.h>

#include <cstdint>

#include "names/fileops.h"
#include "support/hashtable.h"
#include "support/ref.h"

// ---- Location filters (excfilters.cpp) ------------------------------------------------------

// One ignored location. The file name is kept as given; the location object is only ever
// compared through its filter number.
struct ExcFilter {
  char* filename;  // owned copy
  PyObject* loc;   // owned reference
  ExcFilter* next;
};

struct ExcFilters {
  // 4-byte filter number -> head of the list of filters with that number. The number is
  // coarse on purpose: a tuple location counts as the sum of its first two items.
  CU_HashTable table{};
};

void __tracer_init_exception_filters(ExcFilters* filters);
void __tracer_clear_exception_filters(ExcFilters* filters);
// The filter number of a location object: -1 with an error pending when it is not an int
// or a tuple of ints.
int32_t _get_exc_ignore_hash_number(PyObject* loc);
// The filter for `filename` (any spelling of the same file) at `loc`, or null.
ExcFilter* __tracer_exc_filtered(ExcFilters* filters, FileOpsData* file_ops, const char* filename,
                                 PyObject* loc);
// The filter found, or a new one; null when memory runs out (MemoryError set only when the
// table entry could not be made).
ExcFilter* __tracer_add_exc_filter(ExcFilters* filters, FileOpsData* file_ops, const char* filename,
                                   PyObject* loc);
// Removes the filter added with exactly this file name text.
void __tracer_del_exc_filter(ExcFilters* filters, const char* filename, PyObject* loc);
void __tracer_free_exc_filter(ExcFilter* filter);
// The regular-expression parser raises and catches an exception at one line as part of its
// normal work: never report it.
int __tracer_exc_filtered_hack(const char* filename, int lineno);

// ---- Per-frame exception records and the catch-info index (frameexc.cpp, catchinfo.cpp) ----

struct ExcData {
  Ref frame_exc_info;  // dict frame -> argument of the exception in flight there, or null
  Ref catch_info;      // dict function name -> list of catch-info instances, or null
  Ref co_name_str;     // cached attribute names
  Ref mod_name_str;
  Ref prints_str;
  Ref parent_str;
  Ref dunder_name_str;
  Ref containing_class_str;
};

void init_exc_data(ExcData* data);
void reset_exc_data(ExcData* data);

// Records `exc_arg` for `frame`; 0, or -1 with the error set.
int set_frame_exc_info(Ref* frame_exc_info, PyObject* frame, PyObject* exc_arg);
// The recorded argument (borrowed), or null. Sets no error.
PyObject* find_frame_exc_info(Ref* frame_exc_info, PyObject* frame);
// Drops the frame's record, if any; keeps the pending error. Always 0.
int forget_frame_exc_info(Ref* frame_exc_info, PyObject* frame);
// Builds the index from a list of catch-info instances; 0, or -1 with the error set.
int set_catch_info_list(ExcData* data, PyObject* list);
// New reference to the first instance that describes the frame's function, or null.
PyObject* find_catch_info(ExcData* data, PyObject* frame);
int mod_name_matches(ExcData* data, PyObject* mod_name, PyObject* frame);
int containing_class_matches(ExcData* data, PyObject* instance, PyObject* frame);
int frame_prints_exc(ExcData* data, PyObject* frame);
int parent_frame_prints_exc(ExcData* data, PyObject* frame);
