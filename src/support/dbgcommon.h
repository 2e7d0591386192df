// dbgcommon.h: small helpers through which the whole core reaches into the interpreter:
// run-time symbol lookup, the two string-making function pointers, fetching a callable from a
// module, calls with one to three arguments, frame walking and string conversion.
// They own no state of their own beyond the two pointers set at module load.
#pragma once

#include <Python.h>

#include <cstdarg>

#include "support/ref.h"

// The interpreter's string makers, found by name when the module loads. Every string the
// core makes from C text goes through these two pointers.
extern PyObject* (*gPtrTo_PyUnicode_FromString)(const char*);
extern PyObject* (*gPtrTo_PyUnicode_FormatV)(const char*, va_list);

// Address of a function defined in the process's global symbol scope, or null. Sets no
// Python error.
void* lookup_python_function(const char* name);

// New reference to module.attribute when it is callable; null otherwise (the import or
// attribute error is left pending; a non-callable attribute leaves none).
PyObject* get_module_fct(const char* module_name, const char* fct_name);

// Calls with positional arguments borrowed from the caller. New reference, or null with the
// error pending.
PyObject* do_one_arg_call(PyObject* callable, PyObject* arg1);
PyObject* do_two_arg_call(PyObject* callable, PyObject* arg1, PyObject* arg2);
PyObject* do_three_arg_call(PyObject* callable, PyObject* arg1, PyObject* arg2, PyObject* arg3);

// The caller of a frame (new reference, null Ref at the bottom or for a non-frame). Every
// frame walk of the core steps outward with it.
Ref frame_back(PyObject* frame);

// Number of frames of a thread (the calling one when null), innermost to outermost.
int get_stack_depth(PyThreadState* tstate);

// UTF-8 text of a str, owned by the object; null (and no pending error) on failure.
const char* _pystring_to_c_string(PyObject* str);
// The same text copied with malloc (caller frees); null (and no pending error) on failure.
char* _pystring_to_c_string_copy(PyObject* str);
