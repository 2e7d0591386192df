// imports.h: the import hook and the registry of loaded modules.
//
// The core learns of every module the program loads in three ways: a replacement
// __import__ in the builtins (which calls the interpreter's own and registers the result),
// a scan of the modules already loaded when tracing starts, and the call event of every
// module-level code object (which also sees reloads, runpy and importlib, where no import
// statement runs). Registered module files are what breakpoints are matched against.
#pragma once

#include <Python.h>

// Puts the module's __import__ into the builtins of the innermost frame of the calling
// thread (or the builtins module's dictionary when no frame runs). AssertionError when the
// default import given to init is our hook itself.
void __tracer_install_import_hook();
// The replacement __import__.
PyObject* _tracer_import_hook(PyObject* self, PyObject* args, PyObject* kwargs);
// Calls import_cb(module) unless one is running already (in any thread) or it is None.
void __call_import_cb(PyObject* module);
// Registers a module's code and file; its full name, or null.
const char* register_module_direct(PyObject* module);
// Registers the files of the modules loaded before tracing started, and the main script.
void initial_module_scan();
// A call event of module-level code: registers the code and notes the module as executed.
// 0, or -1 with an error pending.
int __tracer_top_level_call(PyObject* frame);
int __tracer_detect_module_reloads(PyObject* code);

// The new-imports list keeps every execution, duplicates included, up to this many entries.
// Past it a path already listed is not added again (a new path still is), so that a program
// that executes module code over and over while the server side never fetches the list
// cannot grow it without bound: it stays within this size plus the number of distinct files.
inline constexpr Py_ssize_t kNewImportsKeepEveryExecution = 10000;
// Puts a new empty new-imports list in place and hands back the one it replaces (owned; null
// with MemoryError pending, the list in force then stays).
PyObject* take_new_imports();
