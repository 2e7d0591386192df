// conames.cpp: the code-object pathname table (see conames.h).
//
// The Python dict owns the entries; every entry also stands for one reference to its code
// object, so a registered address cannot be reused by another code object. address_index
// mirrors the dict for the hot path. A sweep every 5000th call drops, in batches of 100, the
// code objects that only the table still holds.
#include "names/conames.h"

#include <new>

#include "support/dbgcommon.h"
#include "support/dprintf.h"

namespace {

constexpr int32_t kSweepEvery = 5000;
// A batch fits a fixed array on the stack and is collected before anything is deleted, so
// the dict never changes while it is being walked.
constexpr int kSweepBatch = 100;
// Classes nested deeper than this are not searched for methods (cycles end here too).
constexpr int kMaxMatchingDepth = 9;

// ---- The sweep ---------------------------------------------------------------------------

struct SweepBatch {
  Ref keys[kSweepBatch];         // owned: the dict keys to delete
  PyObject* codes[kSweepBatch];  // borrowed from the table's own reference
  int count = 0;
};

// Up to one batch of entries, from the dict's start, whose code object the table alone holds.
void collect_unreferenced(PyObject* dict, SweepBatch* batch) {
  Py_ssize_t pos = 0;
  PyObject* key = nullptr;
  PyObject* value = nullptr;
  while (batch->count < kSweepBatch && PyDict_Next(dict, &pos, &key, &value)) {
    auto* code = static_cast<PyObject*>(PyLong_AsVoidPtr(key));
    if (code == nullptr) {
      PyErr_Clear();
      continue;
    }
    if (Py_REFCNT(code) != 1) continue;
    batch->keys[batch->count] = Ref::borrow(key);
    batch->codes[batch->count++] = code;
  }
}

// The entry leaves the dict and the index before the code object is released: its
// deallocation may run Python code (weakref callbacks) that registers a new code object at
// the very same address, which must not meet the old entry.
void release_batch(COPathnameTable* table, PyObject* dict, SweepBatch* batch) {
  for (int i = 0; i < batch->count; ++i) {
    table->address_index.erase(batch->codes[i]);
    if (table->code_released != nullptr) table->code_released(batch->codes[i]);
    if (PyDict_DelItem(dict, batch->keys[i].get()) < 0) {
      do_dprintf(kDbgPathnames,
                 "FATAL ERROR: UNEXPECTED EXCEPTION in conames.c, CollectGarbage "
                 "(PyDict_DelItem)\n");
      PyErr_Clear();
    }
    Py_DECREF(batch->codes[i]);
  }
}

// ---- Registration ------------------------------------------------------------------------

PyObject* code_name(PyObject* code) {
  return code != nullptr && PyCode_Check(code) ? reinterpret_cast<PyCodeObject*>(code)->co_name
                                               : nullptr;
}

bool is_registered_entry(PyObject* entry) {
  return PyTuple_Check(entry) && PyTuple_GET_SIZE(entry) >= 1 &&
         PyBytes_Check(PyTuple_GET_ITEM(entry, 0));
}

// Makes sure the index has a slot for `code` before the dict changes, so that nothing can
// fail after it did. false when memory runs out.
bool reserve_index_slot(COPathnameTable* table, PyObject* code, bool* is_new) {
  try {
    *is_new = table->address_index.try_emplace(code, nullptr).second;
    return true;
  } catch (const std::bad_alloc&) {
    return false;
  }
}

// Puts `entry` under `key` and takes the table's reference to `code`; -1 with an error set.
int store_entry(COPathnameTable* table, PyObject* code, PyObject* key, PyObject* entry) {
  bool new_slot = false;
  if (!reserve_index_slot(table, code, &new_slot)) {
    PyErr_NoMemory();
    return -1;
  }
  Py_INCREF(code);
  if (PyDict_SetItem(table->dict.get(), key, entry) < 0) {
    Py_DECREF(code);
    if (new_slot) table->address_index.erase(code);
    return -1;
  }
  table->address_index.find(code)->second = PyBytes_AS_STRING(PyTuple_GET_ITEM(entry, 0));
  return 0;
}

// 0 when stored, 1 when `code` is registered already and not forced, -1 with an error set.
// A forced registration of a registered code object takes one more reference and keeps the
// old one: such a code object is pinned in the table for good, which is how it is meant.
int register_one(COPathnameTable* table, PyObject* code, const char* pathname, int force) {
  if (!table->dict) {
    table->dict = Ref::steal(PyDict_New());
    if (!table->dict) return -1;
  }
  Ref key = Ref::steal(PyLong_FromVoidPtr(code));
  if (!key) return -1;
  PyObject* old = PyDict_GetItemWithError(table->dict.get(), key.get());  // borrowed
  if (old == nullptr && PyErr_Occurred()) return -1;
  if (old != nullptr && !force && is_registered_entry(old)) return 1;
  Ref entry = Ref::steal(CreateEntry(pathname, Py_None));
  if (!entry) return -1;
  return store_entry(table, code, key.get(), entry.get());
}

// Nested functions, classes and lambdas share their parent's file.
int register_nested_code(COPathnameTable* table, PyObject* code, const char* pathname, int force) {
  if (!PyCode_Check(code)) return 0;
  Ref consts = Ref::borrow(reinterpret_cast<PyCodeObject*>(code)->co_consts);
  if (!consts || !PyTuple_Check(consts.get())) return 0;
  for (Py_ssize_t i = 0; i < PyTuple_GET_SIZE(consts.get()); ++i) {
    PyObject* item = PyTuple_GET_ITEM(consts.get(), i);
    if (!Py_IS_TYPE(item, &PyCode_Type)) continue;
    if (RegisterCOPathname(table, item, pathname, nullptr, force) != 0) return -1;
  }
  return 0;
}

// ---- Registering a module's functions ----------------------------------------------------

int register_matching_value(RegisterMatchingContext* context, PyObject* value, int depth) {
  if (Py_IS_TYPE(value, &PyFunction_Type))
    return RegisterMatchingFunction(context, value, depth + 1);
  if (Py_IS_TYPE(value, &PyMethod_Type)) {
    return RegisterMatchingFunction(context, PyMethod_GET_FUNCTION(value), depth + 1);
  }
  if (PyType_Check(value)) {
    // Null for the interpreter's static types, which hold no Python functions anyway.
    PyObject* names = reinterpret_cast<PyTypeObject*>(value)->tp_dict;
    if (names != nullptr) return RegisterMatchingDictValues(context, names, depth + 1);
  }
  return 0;
}

}  // namespace

void InitCOPathnameTable(COPathnameTable* table, FileOpsData* file_ops) {
  ClearCOPathnameTable(table);
  table->sweep_counter = 0;
  table->file_ops = file_ops;
  table->path_buffer[0] = '\0';
  table->file_key = Ref::steal(
      gPtrTo_PyUnicode_FromString != nullptr ? gPtrTo_PyUnicode_FromString("__file__") : nullptr);
  // Without the key, __file__ is simply never consulted.
  if (!table->file_key) PyErr_Clear();
}

void ClearCOPathnameTable(COPathnameTable* table) {
  // Detached first: releasing a code object may run code that looks at the table.
  Ref dict = std::move(table->dict);
  table->address_index.clear();
  if (table->code_released != nullptr) table->code_released(nullptr);
  if (!dict) return;
  Py_ssize_t pos = 0;
  PyObject* key = nullptr;
  PyObject* value = nullptr;
  while (PyDict_Next(dict.get(), &pos, &key, &value)) {
    auto* code = static_cast<PyObject*>(PyLong_AsVoidPtr(key));
    if (code != nullptr) {
      Py_DECREF(code);
    } else {
      PyErr_Clear();
    }
  }
}

PyObject* CreateEntry(const char* pathname, PyObject* object) {
  if (pathname == nullptr || object == nullptr) {
    PyErr_BadInternalCall();
    return nullptr;
  }
  Ref path = Ref::steal(PyBytes_FromString(pathname));
  if (!path) return nullptr;
  return PyTuple_Pack(2, path.get(), object);
}

void CollectGarbage(COPathnameTable* table) {
  if (++table->sweep_counter < kSweepEvery) return;
  table->sweep_counter = 0;
  Ref dict = table->dict;
  if (!dict) return;
  int collected = 0;
  // A full batch may have left more behind: start again from the dict's start. The loop
  // ends if releasing code replaced the table's dict, whose entries are then not ours.
  do {
    SweepBatch batch;
    collect_unreferenced(dict.get(), &batch);
    release_batch(table, dict.get(), &batch);
    collected = batch.count;
  } while (collected == kSweepBatch && table->dict.is(dict.get()));
}

const char* LookupCOPathname(COPathnameTable* table, PyObject* code) {
  CollectGarbage(table);
  if (code == nullptr || !table->dict) return nullptr;
  auto found = table->address_index.find(code);
  return found != table->address_index.end() ? found->second : nullptr;
}

int RegisterCOPathname(COPathnameTable* table, PyObject* code, const char* pathname,
                       PyObject* /*ignored*/, int force) {
  do_dprintf(kDbgPathnames, "Registering %s as pathname for code object %p (%s)\n",
             dprint_check_str(pathname), code, dprint_check_pystr(code_name(code)));
  CollectGarbage(table);
  if (code == nullptr) return -1;
  const int stored = register_one(table, code, pathname, force);
  if (stored < 0) {
    PyErr_Clear();
    return -1;
  }
  if (stored == 1) return 0;  // already known: keep the first name
  return register_nested_code(table, code, pathname, force);
}

int RegisterMatchingCodeValues(COPathnameTable* table, const char* pathname, PyObject* globals,
                               int force) {
  do_dprintf(kDbgPathnames, "RegisterMatchingCodeValues: globals = %p\n", globals);
  if (globals == nullptr || !PyDict_Check(globals)) return 0;
  RegisterMatchingContext context{table, pathname, globals, force};
  RegisterMatchingDictValues(&context, globals, 0);
  return 0;
}

int RegisterMatchingDictValues(RegisterMatchingContext* context, PyObject* dict, int depth) {
  do_dprintf(kDbgPathnames,
             "RegisterMatchingDictValues: obj = %p; pathname = %s; globals = %p; depth = %d\n",
             dict, dprint_check_str(context->pathname), context->globals, depth);
  if (depth > kMaxMatchingDepth || dict == nullptr || !PyDict_Check(dict)) return 0;
  Ref held_dict = Ref::borrow(dict);
  do_dprintf(kDbgPathnames, "Starting iteration; dict len = %d",
             static_cast<int>(PyDict_Size(dict)));
  Py_ssize_t pos = 0;
  PyObject* raw_key = nullptr;
  PyObject* raw_value = nullptr;
  while (PyDict_Next(dict, &pos, &raw_key, &raw_value)) {
    // Held: printing and registering may run code that changes the dict.
    Ref key = Ref::borrow(raw_key);
    Ref value = Ref::borrow(raw_value);
    if (dprintf_wanted(kDbgPathnames)) {
      do_dprintf(kDbgPathnames, "Examining %s: type is %s\n", dprint_check_pystr(key.get()),
                 dprint_check_str(Py_TYPE(value.get())->tp_name));
    }
    const int result = register_matching_value(context, value.get(), depth);
    if (result != 0) {
      do_dprintf(kDbgPathnames, "Returning %i from RegisterMatchingDictValues()\n", result);
    }
  }
  return 0;
}

// Only functions whose globals are the module's own count: a function imported from another
// module keeps the file of the module that defined it.
int RegisterMatchingFunction(RegisterMatchingContext* context, PyObject* function, int depth) {
  if (function == nullptr || !Py_IS_TYPE(function, &PyFunction_Type)) {
    do_dprintf(kDbgPathnames, "Non-function object passed to RegisterMatchingFunction\n");
    return -1;
  }
  Ref held_function = Ref::borrow(function);
  do_dprintf(kDbgPathnames, "RegisterMatchingFunction called on %s; depth = %i\n",
             dprint_check_pystr(reinterpret_cast<PyFunctionObject*>(function)->func_name), depth);
  if (depth > kMaxMatchingDepth) return 0;
  Ref code = Ref::borrow(PyFunction_GET_CODE(function));
  if (!code || !PyCode_Check(code.get())) return 0;
  if (PyFunction_GET_GLOBALS(function) != context->globals) return 0;
  return RegisterCOPathname(context->table, code.get(), context->pathname, nullptr, context->force);
}
