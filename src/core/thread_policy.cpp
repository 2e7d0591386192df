// thread_policy.cpp: the selvane mutex and the per-thread debugging policy.
#include "core/thread_policy.h"

#include <cerrno>

#include "core/tracercore.h"
#include "support/dbgcommon.h"
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

void cache_decision(CU_HashEntry* entry, bool debug) {
  CU_SetHashValue(entry, reinterpret_cast<void*>(static_cast<intptr_t>(debug ? 1 : 0)));
}

// Calls debug_thread_cb(identity); the thread's errno is not the callback's business.
long ask_debug_thread_cb(unsigned long identity, CU_HashEntry* entry) {
  int saved_errno = errno;
  Ref callback = gSelf.debug_thread_cb;  // the callback may replace itself
  Ref arg = Ref::steal(PyLong_FromUnsignedLong(identity));
  Ref answer = arg ? Ref::steal(do_one_arg_call(callback.get(), arg.get())) : Ref();
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
  if (entry != nullptr) return CU_GetHashValue(entry) != nullptr ? 1 : 0;
  int is_new = 0;
  entry = CU_CreateHashEntry(&gSelf.debug_thread_map, &identity, &is_new);
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
