// containing_class.h: the class whose body defines the function that a frame runs.
//
// Only the module's top-level classes and their own namespaces are searched, for functions
// stored there as plain functions: no base classes, no nested classes, no decorated
// methods. The catch-info rules name classes at that depth.
#pragma once

#include <Python.h>

// New reference to the class, None (new reference) when none defines `code`, or null on error
// (none occurs; callers treat null as their own failure).
PyObject* GetContainingClass(PyObject* code, PyObject* globals);
PyObject* ScanForContainingClass(PyObject* dict, PyObject* code, int depth);
// New reference to `cls` when it defines `code`, else None (new reference).
PyObject* FindInSingleClass(PyObject* cls, PyObject* code);
// The class's own name (tp_name, borrowed), or null for an object that is not a class.
const char* GetPyClassName(PyObject* object);
