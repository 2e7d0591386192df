// excfilters.cpp: the locations where exceptions are not to stop the program again (see
// exceptops.h).
//
// Adding and finding a filter accept any spelling of the same file (samefile); removing one
// needs the very text that was added. A debugger adds with the name under which it reported
// the exception and removes with the same name, and a looser removal could take out a filter
// the user set elsewhere.
#include <cstdlib>
#include <cstring>
#include <vector>

#include "exc/exceptops.h"

namespace {

constexpr int32_t kFilterKeySize = sizeof(int32_t);

ExcFilter* chain_of(CU_HashEntry* entry) {
  return entry != nullptr ? static_cast<ExcFilter*>(CU_GetHashValue(entry)) : nullptr;
}

void free_chain(ExcFilter* filter) {
  while (filter != nullptr) {
    ExcFilter* next = filter->next;
    __tracer_free_exc_filter(filter);
    filter = next;
  }
}

}  // namespace

void __tracer_init_exception_filters(ExcFilters* filters) {
  CU_InitHashTable(&filters->table, kFilterKeySize);
}

void __tracer_clear_exception_filters(ExcFilters* filters) {
  // Detach every chain before releasing anything: releasing a location object can run code.
  bool made = filters->table.buckets != nullptr;
  std::vector<ExcFilter*> chains;
  if (made) {
    CU_HashSearch search;
    for (CU_HashEntry* e = CU_FirstHashEntry(&filters->table, &search); e != nullptr;
         e = CU_NextHashEntry(&search)) {
      chains.push_back(chain_of(e));
    }
    CU_DeleteHashTable(&filters->table);
  }
  __tracer_init_exception_filters(filters);
  for (ExcFilter* chain : chains) free_chain(chain);
}

int32_t _get_exc_ignore_hash_number(PyObject* loc) {
  if (PyTuple_Check(loc)) {
    // A tuple location counts as the sum of its first two items: a coarse number, told apart
    // by file name only, on purpose.
    if (PyTuple_GET_SIZE(loc) < 2) {
      PyErr_SetString(PyExc_TypeError, "a location tuple needs two ints");
      return -1;
    }
    long first = PyLong_AsLong(PyTuple_GET_ITEM(loc, 0));
    long second = PyLong_AsLong(PyTuple_GET_ITEM(loc, 1));
    return static_cast<int32_t>(static_cast<uint32_t>(first) + static_cast<uint32_t>(second));
  }
  return static_cast<int32_t>(PyLong_AsLong(loc));
}

ExcFilter* __tracer_exc_filtered(ExcFilters* filters, FileOpsData* file_ops, const char* filename,
                                 PyObject* loc) {
  if (filename == nullptr) return nullptr;
  int32_t number = _get_exc_ignore_hash_number(loc);
  for (ExcFilter* f = chain_of(CU_FindHashEntry(&filters->table, &number)); f != nullptr;
       f = f->next) {
    if (samefile(file_ops, filename, f->filename)) return f;
  }
  return nullptr;
}

ExcFilter* __tracer_add_exc_filter(ExcFilters* filters, FileOpsData* file_ops, const char* filename,
                                   PyObject* loc) {
  ExcFilter* found = __tracer_exc_filtered(filters, file_ops, filename, loc);
  if (found != nullptr) return found;
  int32_t number = _get_exc_ignore_hash_number(loc);
  auto* filter = static_cast<ExcFilter*>(std::calloc(1, sizeof(ExcFilter)));
  char* name = filter != nullptr ? strdup(filename) : nullptr;
  if (name == nullptr) {
    std::free(filter);
    return nullptr;
  }
  filter->filename = name;
  filter->loc = Py_NewRef(loc);
  int is_new = 0;
  CU_HashEntry* entry = CU_CreateHashEntry(&filters->table, &number, &is_new);
  if (entry == nullptr) {
    PyErr_SetString(PyExc_MemoryError, "Out of memory");
    __tracer_free_exc_filter(filter);
    return nullptr;
  }
  filter->next = is_new ? nullptr : chain_of(entry);
  CU_SetHashValue(entry, filter);
  return filter;
}

void __tracer_del_exc_filter(ExcFilters* filters, const char* filename, PyObject* loc) {
  int32_t number = _get_exc_ignore_hash_number(loc);
  CU_HashEntry* entry = CU_FindHashEntry(&filters->table, &number);
  if (entry == nullptr) return;
  ExcFilter** link = reinterpret_cast<ExcFilter**>(&entry->value);
  while (*link != nullptr && std::strcmp((*link)->filename, filename) != 0) {
    link = &(*link)->next;
  }
  ExcFilter* removed = *link;
  if (removed == nullptr) return;
  *link = removed->next;
  if (CU_GetHashValue(entry) == nullptr) CU_DeleteHashEntry(entry);
  __tracer_free_exc_filter(removed);
}

void __tracer_free_exc_filter(ExcFilter* filter) {
  if (filter == nullptr) return;
  PyObject* loc = filter->loc;
  std::free(filter->filename);
  std::free(filter);
  Py_XDECREF(loc);
}

int __tracer_exc_filtered_hack(const char* filename, int lineno) {
  static constexpr char kParser[] = "sre_parse.py";
  constexpr size_t kLength = sizeof kParser - 1;
  if (filename == nullptr || lineno != 134) return 0;
  size_t length = std::strlen(filename);
  return length >= kLength && std::strcmp(filename + length - kLength, kParser) == 0 ? 1 : 0;
}
