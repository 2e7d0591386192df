// conames.h: code objects to the full path names of their source files, file-name
// resolution and comparison.
//
// A code object only knows the name it was compiled with (often relative); breakpoints and
// filters are matched by full path names. The table resolves each code object once and keeps
// it alive while registered, so that its address is not reused by another code object; a
// sweep every 5000 calls drops code objects that only the table still holds.
// The file-system caches live in fileops.h and the pure text helpers in pathtext.h.
#pragma once

#include <Python.h>

#include <cstdint>
#include <unordered_map>

#include "names/fileops.h"
#include "names/pathtext.h"
#include "support/ref.h"

struct COPathnameTable {
  // Owned, or null until the first registration. Key: int of the code object's address;
  // value: (bytes full path, None). Every key also stands for one reference to the code
  // object that the table took when it registered it.
  Ref dict;
  int32_t sweep_counter = 0;               // lookups and registrations since the last sweep
  FileOpsData* file_ops = nullptr;         // borrowed
  char path_buffer[kMaxPathLen + 1] = {};  // result of __tracer_get_relative_path
  Ref file_key;                            // owned: the str "__file__"
  // Code object address -> the text of its path bytes in `dict` (borrowed from the entry).
  // Answers a lookup with one hash probe and no allocation; kept in step with `dict`.
  std::unordered_map<const PyObject*, const char*> address_index;
  // Told when the table lets a code object go (null: all of them), before its reference is
  // dropped: caches keyed by code address must forget it, as the address may be reused.
  void (*code_released)(const PyObject* code) = nullptr;
};

void InitCOPathnameTable(COPathnameTable* table, FileOpsData* file_ops);
// Drops every entry, releasing the reference each registration took. The tracer keeps its
// table for the life of the process; this is for owners with a shorter life (tests).
void ClearCOPathnameTable(COPathnameTable* table);

// New tuple (bytes of `pathname`, `object`), or null with an error set.
PyObject* CreateEntry(const char* pathname, PyObject* object);
// The periodic sweep; counts the call and works only on every 5000th.
void CollectGarbage(COPathnameTable* table);

// The registered full path of `code` (valid while its entry exists), or null.
const char* LookupCOPathname(COPathnameTable* table, PyObject* code);
// Registers `code` and the code objects nested in its constants. 0, or -1 with no error
// left pending. `ignored` is not used.
int RegisterCOPathname(COPathnameTable* table, PyObject* code, const char* pathname,
                       PyObject* ignored, int force);

// What the walk over a module's globals registers against; made on the stack.
struct RegisterMatchingContext {
  COPathnameTable* table;
  const char* pathname;
  PyObject* globals;  // borrowed: the module's globals; only functions with these globals count
  int force;
};

// Registers the code of the module's own functions and of the methods of its classes.
int RegisterMatchingCodeValues(COPathnameTable* table, const char* pathname, PyObject* globals,
                               int force);
int RegisterMatchingFunction(RegisterMatchingContext* context, PyObject* function, int depth);
int RegisterMatchingDictValues(RegisterMatchingContext* context, PyObject* dict, int depth);

// ---- From code objects and frames to file names (codefile.cpp) ---------------------------

// 1 when the module's `__file__` should be preferred to the code's `co_filename`; the files
// are statted through `file_ops`' cache.
int use_globals_name(FileOpsData* file_ops, const char* globals_file, const char* co_filename);
// The better of globals["__file__"] and co_filename; borrowed from those objects.
const char* find_codefile(COPathnameTable* table, PyObject* globals, PyObject* co_filename);
// The code's file name as found, in the table's path_buffer (valid until the next call).
const char* __tracer_get_relative_path(COPathnameTable* table, PyObject* globals,
                                       PyObject* co_filename);
// The frame's full file name, "<cframe>" for a non-frame, or null after a lookup error.
const char* __tracer_get_full_path(COPathnameTable* table, PyObject* frame);
// Resolves and registers a module's file when it is imported or first seen; the full name
// or null (names like "<string>" have none).
const char* __resolve_module_full_path(COPathnameTable* table, PyObject* globals,
                                       PyObject* co_filename, PyObject* code);
