// thread_policy.cpp: the selvane mutex and the per-thread debugging policy.
#include "core/thread_policy.h"

#include <cerrno>

#include "core/tracercore.h"
#include "support/dbgcommon.h"
#include "support/pycompat.h"
#include "support/dprintf.h"
#include "threads/threadops.h"

int acquire_selvane_mutex() {
  int acquired = acquire_thread_mutex(gSelf.thread_mutex, 1);
  if (acquired) gSelf.selvane_mutex_owner = get_thread_ident();
  return acquired;
}

void release_selvane_mutex() {
  // A release by a thread that does not hold the mutex is ignored.
  if (gSelf.selvane_mutex_owner != get_thread_ident()) return;
  gSelf.selvane_mutex_owner = kNoMutexOwner;
  release_thread_mutex(gSelf.thread_mutex);
}

namespace {

// A cached decision is stamped with the thread state it was made for. Thread identities are
// reused by later threads, and a refused thread is never traced, so no return of its bottom
// frame clears its entry; nor need the server side tell us when threads end. A thread state
// id is never reused: a stamp that differs from the calling thread state's marks an answer
// given to an earlier thread, and the callback is asked again.
uintptr_t stamp_of_current_thread() {
  PyThreadState* ts = compat::current_tstate();
  return ts != nullptr ? static_cast<uintptr_t>(PyThreadState_GetID(ts)) : 0;
}

void cache_decision(CU_HashEntry* entry, bool debug) {
  uintptr_t value = (stamp_of_current_thread() << 1) | (debug ? 1 : 0);
  CU_SetHashValue(entry, reinterpret_cast<void*>(value));
}

bool cached_for_current_thread(CU_HashEntry* entry) {
  auto value = reinterpret_cast<uintptr_t>(CU_GetHashValue(entry));
  return (value >> 1) == (stamp_of_current_thread() & (UINTPTR_MAX >> 1));
}

bool cached_decision(CU_HashEntry* entry) {
  return (reinterpret_cast<uintptr_t>(CU_GetHashValue(entry)) & 1) != 0;
}

// Calls debug_thread_cb(identity); the thread's errno is not the callback's business.
long ask_debug_thread_cb(unsigned long identity, CU_HashEntry* entry) {
  int saved_errno = errno;
  PyThreadState* ts = compat::current_tstate();
  int tracing_floor = compat::tracing_get(ts);
  Ref callback = gSelf.debug_thread_cb;  // the callback may replace itself
  Ref arg = Ref::steal(PyLong_FromUnsignedLong(identity));
  Ref answer = arg ? Ref::steal(do_one_arg_call(callback.get(), arg.get())) : Ref();
  // As for every callback run inside the trace function: the interpreter's own unit of the
  // tracing counter must still be there when we return.
  compat::tracing_repair(ts, tracing_floor);
  errno = saved_errno;
  long decision = answer ? PyLong_AsLong(answer.get()) : -1;
  if (!answer || (decision == -1 && PyErr_Occurred() != nullptr)) {
    do_dprintf(kDbgFlow, "ignoring failure to call debug_thread_cb");
    PyErr_Clear();
    decision = 1;
  }
  // The callback may have replaced itself (and so emptied the cache): only cache the
  // answer in the map the entry still belongs to.
  if (CU_FindHashEntry(&gSelf.debug_thread_map, &identity) == entry) {
    cache_decision(entry, decision != 0);
  }
  return decision;
}

}  // namespace

int __should_debug_thread(unsigned long identity) {
  if (!gSelf.debug_thread_cb) return 1;
  CU_HashEntry* entry = CU_FindHashEntry(&gSelf.debug_thread_map, &identity);
  if (entry != nullptr && cached_for_current_thread(entry)) return cached_decision(entry) ? 1 : 0;
  int is_new = 0;
  if (entry == nullptr) entry = CU_CreateHashEntry(&gSelf.debug_thread_map, &identity, &is_new);
  if (entry == nullptr) {
    do_dprintf(kDbgFlow, "failure to cache in debug_thread_map");
    return 1;
  }
  cache_decision(entry, false);
  long decision = ask_debug_thread_cb(identity, entry);
  // The first answer is the callback's own number, truncated to what callers test.
  return decision > INT32_MAX || decision < INT32_MIN ? 1 : static_cast<int>(decision);
}

void __clear_should_debug_thread_cache(unsigned long identity) {
  CU_HashEntry* entry = CU_FindHashEntry(&gSelf.debug_thread_map, &identity);
  if (entry != nullptr) CU_DeleteHashEntry(entry);
}
