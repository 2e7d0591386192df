// threadops.cpp: thread table, thread identity and thread mutex (see threadops.h).
#include "threads/threadops.h"

#include <cerrno>
#include <new>
#include <vector>

#include "support/dbgcommon.h"
#include "support/dprintf.h"
#include "support/pycompat.h"

unsigned long (*gGetThreadIdentFunc)(void) = nullptr;

namespace {
// Bumped whenever a record leaves a table, so that a cached record pointer is never used
// after the record is freed.
uint64_t gThreadTableGeneration = 1;

// The record found last. One entry is enough: events come in runs from one thread, and
// the interpreter lock serialises every use, so a plain global needs no thread-local
// storage (which costs a call per access in a shared object).
struct CachedRecord {
  CU_HashTable* table = nullptr;
  PyThreadState* tstate = nullptr;
  ThreadData* data = nullptr;
  uint64_t generation = 0;
};
CachedRecord gCachedRecord;
}  // namespace

void init_threadops() {
  gGetThreadIdentFunc = reinterpret_cast<unsigned long (*)(void)>(
      lookup_python_function("PyThread_get_thread_ident"));
  do_dprintf(kDbgFlow, "Thread ident function is %p\n",
             reinterpret_cast<void*>(gGetThreadIdentFunc));
  if (PyErr_Occurred() != nullptr) PyErr_Clear();
}

unsigned long get_thread_ident() {
  return gGetThreadIdentFunc != nullptr ? gGetThreadIdentFunc() : 1;
}

PyThread_type_lock allocate_thread_mutex() {
  return PyThread_allocate_lock();
}

int acquire_thread_mutex(PyThread_type_lock lock, int wait) {
  if (lock == nullptr) return 1;
  int saved_errno = errno;
  int acquired = PyThread_acquire_lock(lock, NOWAIT_LOCK);
  if (!acquired && wait) {
    // Only the blocking wait runs without the interpreter lock, so the holder of the mutex
    // can go on running Python code meanwhile.
    PyThreadState* saved = PyEval_SaveThread();
    acquired = PyThread_acquire_lock(lock, WAIT_LOCK);
    PyEval_RestoreThread(saved);
  }
  errno = saved_errno;
  return acquired ? 1 : 0;
}

void release_thread_mutex(PyThread_type_lock lock) {
  if (lock == nullptr) return;
  int saved_errno = errno;
  PyThread_release_lock(lock);
  errno = saved_errno;
}

ThreadData* new_thread_data(PyThreadState* tstate) {
  ThreadData* data = new (std::nothrow) ThreadData();
  if (data == nullptr) return nullptr;
  data->tstate = tstate;
  data->thread_id = compat::tstate_thread_id(tstate);
  data->thread_name = Ref::none();
  data->bot_frame = Ref::none();
  data->step_out_frame = Ref::none();
  data->curr_frame = Ref::none();
  return data;
}

void free_thread_data(ThreadData* data) {
  if (data == nullptr) return;
  data->bot_frame.reset();
  data->stop_frame.reset();
  data->step_out_frame.reset();
  data->curr_frame.reset();
  data->thread_name.reset();
  data->sub_language_frame.reset();
  data->sub_language_hook.reset();
  data->pending_exception.reset();
  delete data;
}

void init_thread_table(CU_HashTable* table) {
  CU_InitHashTable(table, sizeof(PyThreadState*));
}

ThreadData* find_thread_data(CU_HashTable* table, PyThreadState* tstate) {
  CU_HashEntry* entry = CU_FindHashEntry(table, &tstate);
  return entry != nullptr ? static_cast<ThreadData*>(CU_GetHashValue(entry)) : nullptr;
}

ThreadData* insert_thread_data(CU_HashTable* table, PyThreadState* tstate) {
  ThreadData* existing = find_thread_data(table, tstate);
  if (existing != nullptr) return existing;
  ThreadData* data = new_thread_data(tstate);
  int is_new = 0;
  CU_HashEntry* entry = data != nullptr ? CU_CreateHashEntry(table, &tstate, &is_new) : nullptr;
  if (entry == nullptr) {
    PyErr_SetString(PyExc_MemoryError, "Out of memory");
    free_thread_data(data);
    return nullptr;
  }
  CU_SetHashValue(entry, data);
  return data;
}

void renew_thread_data(ThreadData* data) {
  // The record is consistent before any reference goes: dropping one can run finalizers
  // that trace or ask the table about this thread.
  Ref held[] = {std::move(data->bot_frame),          std::move(data->stop_frame),
                std::move(data->step_out_frame),     std::move(data->thread_name),
                std::move(data->sub_language_frame), std::move(data->sub_language_hook),
                std::move(data->pending_exception)};
  data->tracer_in_frames = 0;
  data->global_trace_set = 0;
  data->events_off = 0;
  data->run_reached = -1;
  data->thread_name = Ref::none();
  data->bot_frame = Ref::none();
  data->step_out_frame = Ref::none();
  data->line_range_start = -1;
  data->line_range_end = -1;
  data->leaving_bot_frame = 0;
  data->last_exception_frame = nullptr;
  data->unhandled_stop_exc = nullptr;
  data->unhandled_stop_frame = nullptr;
  data->unhandled_stop_code = nullptr;
  data->exception_leaving_frame = nullptr;
  data->with_may_suppress_in = nullptr;
  data->unhandled_stop_frame = nullptr;
  ++gThreadTableGeneration;
  for (Ref& ref : held) ref.reset();
}

void remove_thread_data(CU_HashTable* table, PyThreadState* tstate) {
  CU_HashEntry* entry = CU_FindHashEntry(table, &tstate);
  if (entry == nullptr) return;
  ThreadData* data = static_cast<ThreadData*>(CU_GetHashValue(entry));
  if (data->pins > 0) {
    renew_thread_data(data);
    return;
  }
  // Unlink before releasing: dropping a frame can run finalizers that trace or ask the
  // table about this thread, and they must not find a half-freed record.
  CU_DeleteHashEntry(entry);
  ++gThreadTableGeneration;
  free_thread_data(data);
}

namespace {
// Puts a pinned record back into a cleared table. Without memory for the entry it is left
// out of the table but not freed (its holders still use it): a bounded loss on a path that
// only memory exhaustion takes.
void keep_pinned(CU_HashTable* table, ThreadData* data) {
  int is_new = 0;
  CU_HashEntry* entry = CU_CreateHashEntry(table, &data->tstate, &is_new);
  if (entry == nullptr) {
    do_dprintf(kDbgFlow, "failure to keep a busy thread record\n");
    return;
  }
  CU_SetHashValue(entry, data);
}
}  // namespace

void clear_thread_table(CU_HashTable* table) {
  // Detach every record first, then release them, for the same reason as above.
  std::vector<ThreadData*> records;
  records.reserve(table->num_entries);
  CU_HashSearch search;
  CU_HashEntry* entry = CU_FirstHashEntry(table, &search);
  while (entry != nullptr) {
    records.push_back(static_cast<ThreadData*>(CU_GetHashValue(entry)));
    CU_HashEntry* done = entry;
    entry = CU_NextHashEntry(&search);
    CU_DeleteHashEntry(done);
  }
  CU_DeleteHashTable(table);
  init_thread_table(table);
  ++gThreadTableGeneration;
  for (ThreadData* data : records) {
    if (data->pins > 0) keep_pinned(table, data);
  }
  for (ThreadData* data : records) {
    if (data->pins > 0) {
      renew_thread_data(data);
    } else {
      free_thread_data(data);
    }
  }
}

void drop_pins_of_vanished_threads(CU_HashTable* table, PyThreadState* survivor) {
  CU_HashSearch search;
  for (CU_HashEntry* e = CU_FirstHashEntry(table, &search); e != nullptr;
       e = CU_NextHashEntry(&search)) {
    auto* data = static_cast<ThreadData*>(CU_GetHashValue(e));
    if (data->tstate == survivor) continue;
    data->pins = 0;
    data->dispatch_event = nullptr;
  }
}

ThreadData* get_current_thread_data(CU_HashTable* table) {
  PyThreadState* tstate = compat::current_tstate();
  if (tstate == nullptr) return nullptr;
  ThreadData* data = find_thread_data(table, tstate);
  if (data != nullptr) data->thread_id = compat::tstate_thread_id(tstate);
  return data;
}

PyObject* id_for_tstate_ptr(PyThreadState* tstate) {
  return PyLong_FromVoidPtr(tstate);
}

PyThreadState* tstate_ptr_for_id(PyObject* id) {
  return static_cast<PyThreadState*>(PyLong_AsVoidPtr(id));
}

ThreadData* thread_data_for(CU_HashTable* table, PyThreadState* tstate) {
  CachedRecord& cache = gCachedRecord;
  if (cache.tstate == tstate && cache.table == table &&
      cache.generation == gThreadTableGeneration && tstate != nullptr) {
    return cache.data;
  }
  if (tstate == nullptr) return nullptr;
  ThreadData* data = insert_thread_data(table, tstate);
  if (data != nullptr) cache = CachedRecord{table, tstate, data, gThreadTableGeneration};
  return data;
}

ThreadData* current_thread_data_or_insert(CU_HashTable* table) {
  return thread_data_for(table, compat::current_tstate());
}
