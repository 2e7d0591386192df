// import_methods.cpp: the record of modules loaded or reloaded since the server side last
// asked. The list is handed over, not copied; a new empty one takes its place.
#include <Python.h>

#include "core/tracercore.h"
#include "module/methods.h"

PyObject* _tracer_get_new_imports(PyObject*, PyObject*) {
  Ref fresh = Ref::steal(PyList_New(0));
  if (!fresh) return nullptr;
  Ref current = gSelf.new_imports ? gSelf.new_imports : Ref::steal(PyList_New(0));
  if (!current) return nullptr;
  gSelf.new_imports = fresh;
  return current.release();
}
