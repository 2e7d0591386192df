// test_threadops.cpp: the table of per-thread records (creation, identity of records, the
// release of everything a record holds, reuse of thread-state memory by the interpreter, the
// per-thread cache of the hot path), the thread mutex and its errno discipline, and the ids
// under which Python code sees thread states.
#include "threads/threadops.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <mutex>
#include <thread>
#include <unordered_map>
#include <utility>
#include <vector>

#include "core_test_support.h"

namespace {

using coretest::refs;

class ThreadTableTest : public coretest::PythonTest {
 protected:
  void SetUp() override {
    PythonTest::SetUp();
    init_thread_table(&table_);
  }
  void TearDown() override {
    clear_thread_table(&table_);
    CU_DeleteHashTable(&table_);
    for (PyThreadState* ts : extra_states_) {
      PyThreadState_Clear(ts);
      PyThreadState_Delete(ts);
    }
    PythonTest::TearDown();
  }
  // A real thread state of this interpreter, not bound to any running thread.
  PyThreadState* new_state() {
    PyThreadState* ts = PyThreadState_New(PyThreadState_Get()->interp);
    EXPECT_NE(ts, nullptr);
    extra_states_.push_back(ts);
    return ts;
  }

  CU_HashTable table_{};
  std::vector<PyThreadState*> extra_states_;
};

TEST_F(ThreadTableTest, CurrentThreadNeverSeenHasNoRecordAndGetsNone) {
  EXPECT_EQ(get_current_thread_data(&table_), nullptr);
  EXPECT_EQ(table_.num_entries, 0u);
  // A record of another thread does not answer for this one.
  insert_thread_data(&table_, new_state());
  EXPECT_EQ(get_current_thread_data(&table_), nullptr);
  EXPECT_EQ(table_.num_entries, 1u);
}

TEST_F(ThreadTableTest, NewRecordHasTheInitialValues) {
  PyThreadState* ts = PyThreadState_Get();
  ThreadData* data = insert_thread_data(&table_, ts);
  ASSERT_NE(data, nullptr);
  EXPECT_EQ(data->tstate, ts);
  EXPECT_EQ(data->thread_id, ts->thread_id);
  EXPECT_EQ(data->tracer_in_frames, 0);
  EXPECT_EQ(data->global_trace_set, 0);
  EXPECT_TRUE(data->thread_name.is_none());
  EXPECT_TRUE(data->bot_frame.is_none());
  EXPECT_FALSE(data->stop_frame);  // null runs freely, unlike None
  EXPECT_TRUE(data->step_out_frame.is_none());
  EXPECT_TRUE(data->curr_frame.is_none());
  EXPECT_EQ(data->line_range_start, -1);
  EXPECT_EQ(data->line_range_end, -1);
  EXPECT_FALSE(data->sub_language_frame);
  EXPECT_FALSE(data->sub_language_hook);
  EXPECT_EQ(data->leaving_bot_frame, 0);
  EXPECT_FALSE(data->pending_exception);
}

TEST_F(ThreadTableTest, InsertingTwiceGivesTheSameRecord) {
  PyThreadState* ts = PyThreadState_Get();
  ThreadData* first = insert_thread_data(&table_, ts);
  ASSERT_NE(first, nullptr);
  first->line_range_start = 11;
  ThreadData* second = insert_thread_data(&table_, ts);
  EXPECT_EQ(second, first);
  EXPECT_EQ(second->line_range_start, 11);
  EXPECT_EQ(table_.num_entries, 1u);
  EXPECT_EQ(find_thread_data(&table_, ts), first);
  EXPECT_EQ(get_current_thread_data(&table_), first);
}

TEST_F(ThreadTableTest, CurrentLookupRefreshesTheThreadId) {
  ThreadData* data = insert_thread_data(&table_, PyThreadState_Get());
  ASSERT_NE(data, nullptr);
  data->thread_id = 0;
  EXPECT_EQ(find_thread_data(&table_, PyThreadState_Get())->thread_id, 0u);  // find only finds
  ASSERT_EQ(get_current_thread_data(&table_), data);
  EXPECT_EQ(data->thread_id, PyThread_get_thread_ident());
}

// Fills every owned field of a record with its own object, so a leak shows which field.
struct HeldObjects {
  static constexpr int kCount = 8;
  Ref objects[kCount];
  Py_ssize_t before[kCount];

  HeldObjects() {
    for (int i = 0; i < kCount; ++i) {
      objects[i] = Ref::steal(PyList_New(0));
      before[i] = refs(objects[i].get());
    }
  }
  void store_in(ThreadData* data) {
    Ref* fields[kCount] = {&data->thread_name,       &data->bot_frame,
                           &data->stop_frame,        &data->step_out_frame,
                           &data->curr_frame,        &data->sub_language_frame,
                           &data->sub_language_hook, &data->pending_exception};
    for (int i = 0; i < kCount; ++i) *fields[i] = objects[i];
  }
  void expect_released() const {
    for (int i = 0; i < kCount; ++i) EXPECT_EQ(refs(objects[i].get()), before[i]) << "field " << i;
  }
};

TEST_F(ThreadTableTest, ClearingReleasesEveryRecordsReferences) {
  HeldObjects mine, other, third;
  mine.store_in(insert_thread_data(&table_, PyThreadState_Get()));
  other.store_in(insert_thread_data(&table_, new_state()));
  third.store_in(insert_thread_data(&table_, new_state()));
  ASSERT_EQ(table_.num_entries, 3u);
  clear_thread_table(&table_);
  mine.expect_released();
  other.expect_released();
  third.expect_released();
  EXPECT_EQ(table_.num_entries, 0u);
  EXPECT_EQ(get_current_thread_data(&table_), nullptr);
}

TEST_F(ThreadTableTest, ClearedTableAcceptsNewThreads) {
  for (int i = 0; i < 20; ++i) insert_thread_data(&table_, new_state());
  clear_thread_table(&table_);
  PyThreadState* ts = new_state();
  ThreadData* data = insert_thread_data(&table_, ts);
  ASSERT_NE(data, nullptr);
  EXPECT_EQ(find_thread_data(&table_, ts), data);
  ThreadData* mine = insert_thread_data(&table_, PyThreadState_Get());
  EXPECT_EQ(get_current_thread_data(&table_), mine);
  EXPECT_EQ(table_.num_entries, 2u);
}

TEST_F(ThreadTableTest, RemovingReleasesTheRecordsReferencesAndOnlyThatRecord) {
  HeldObjects removed, kept;
  PyThreadState* ts = new_state();
  removed.store_in(insert_thread_data(&table_, ts));
  kept.store_in(insert_thread_data(&table_, PyThreadState_Get()));
  remove_thread_data(&table_, ts);
  removed.expect_released();
  EXPECT_EQ(find_thread_data(&table_, ts), nullptr);
  EXPECT_NE(get_current_thread_data(&table_), nullptr);
  EXPECT_EQ(refs(kept.objects[0].get()), kept.before[0] + 1);
  remove_thread_data(&table_, ts);  // a second removal finds nothing and does nothing
  EXPECT_EQ(table_.num_entries, 1u);
}

// ---- pinned records -------------------------------------------------------------------------

// A thread that waits inside an event holds its record: clearing the table (reset, init)
// must not free it under the waiting thread, but give it the state of a new record.
TEST_F(ThreadTableTest, ClearingRenewsAPinnedRecordInPlace) {
  HeldObjects held, other;
  ThreadData* data = insert_thread_data(&table_, PyThreadState_Get());
  held.store_in(data);
  data->line_range_start = 3;
  data->line_range_end = 4;
  data->tracer_in_frames = 1;
  data->global_trace_set = 1;
  other.store_in(insert_thread_data(&table_, new_state()));
  {
    PinnedThreadData pin(data);
    clear_thread_table(&table_);
    other.expect_released();
    EXPECT_EQ(table_.num_entries, 1u);
    ASSERT_EQ(get_current_thread_data(&table_), data);
    EXPECT_EQ(data->pins, 1);
    EXPECT_FALSE(data->stop_frame);
    EXPECT_TRUE(data->bot_frame.is_none());
    EXPECT_TRUE(data->step_out_frame.is_none());
    EXPECT_TRUE(data->thread_name.is_none());
    EXPECT_FALSE(data->pending_exception);
    EXPECT_EQ(data->line_range_start, -1);
    EXPECT_EQ(data->line_range_end, -1);
    EXPECT_EQ(data->tracer_in_frames, 0);
    EXPECT_EQ(data->global_trace_set, 0);
    // The frame of the event in progress stays: it is still the thread's current frame.
    EXPECT_TRUE(data->curr_frame.is(held.objects[4].get()));
  }
  EXPECT_EQ(data->pins, 0);
  clear_thread_table(&table_);
  held.expect_released();
  EXPECT_EQ(table_.num_entries, 0u);
}

TEST_F(ThreadTableTest, RemovingAPinnedRecordRenewsItAndKeepsIt) {
  HeldObjects held;
  PyThreadState* ts = new_state();
  ThreadData* data = insert_thread_data(&table_, ts);
  held.store_in(data);
  {
    PinnedThreadData pin(data);
    remove_thread_data(&table_, ts);
    EXPECT_EQ(find_thread_data(&table_, ts), data);
    EXPECT_FALSE(data->stop_frame);
  }
  remove_thread_data(&table_, ts);
  EXPECT_EQ(find_thread_data(&table_, ts), nullptr);
  held.expect_released();
}

TEST_F(ThreadTableTest, PinsOfThreadsThatVanishedInAForkAreDropped) {
  PyThreadState* gone = new_state();
  ThreadData* vanished = insert_thread_data(&table_, gone);
  ThreadData* mine = insert_thread_data(&table_, PyThreadState_Get());
  ++vanished->pins;  // as if that thread had an event in flight when the process forked
  PinnedThreadData pin(mine);
  drop_pins_of_vanished_threads(&table_, PyThreadState_Get());
  EXPECT_EQ(vanished->pins, 0);
  EXPECT_EQ(mine->pins, 1);
  clear_thread_table(&table_);
  EXPECT_EQ(find_thread_data(&table_, gone), nullptr);
  EXPECT_EQ(get_current_thread_data(&table_), mine);
}

// Makes the interpreter's raw allocator give the memory of one freed block to the next
// request of the same size, as a plain malloc usually does with a freed thread state. Under
// AddressSanitizer freed memory is quarantined and the interpreter would never hand out the
// same thread-state address again, so the reuse is arranged through the interpreter's own
// allocator hook instead of being left to chance.
class RawMemoryReuse {
 public:
  RawMemoryReuse() {
    PyMem_GetAllocator(PYMEM_DOMAIN_RAW, &original_);
    PyMemAllocatorEx hook = {this, hook_malloc, hook_calloc, hook_realloc, hook_free};
    PyMem_SetAllocator(PYMEM_DOMAIN_RAW, &hook);
  }
  ~RawMemoryReuse() {
    PyMem_SetAllocator(PYMEM_DOMAIN_RAW, &original_);
    if (kept_ != nullptr) original_.free(original_.ctx, kept_);
  }
  RawMemoryReuse(const RawMemoryReuse&) = delete;
  RawMemoryReuse& operator=(const RawMemoryReuse&) = delete;

  // The next free of `block` keeps it for the next request of its size.
  void reuse_next(void* block) {
    std::lock_guard<std::mutex> guard(mutex_);
    target_ = block;
  }

 private:
  static RawMemoryReuse* self(void* ctx) { return static_cast<RawMemoryReuse*>(ctx); }
  void* take_kept(size_t size) {
    if (kept_ == nullptr || size != kept_size_) return nullptr;
    return std::exchange(kept_, nullptr);
  }
  void* remember(void* block, size_t size) {
    if (block != nullptr) sizes_[block] = size;
    return block;
  }
  static void* hook_malloc(void* ctx, size_t size) {
    RawMemoryReuse* me = self(ctx);
    std::lock_guard<std::mutex> guard(me->mutex_);
    if (void* block = me->take_kept(size)) return me->remember(block, size);
    return me->remember(me->original_.malloc(me->original_.ctx, size), size);
  }
  static void* hook_calloc(void* ctx, size_t count, size_t size) {
    RawMemoryReuse* me = self(ctx);
    std::lock_guard<std::mutex> guard(me->mutex_);
    if (void* block = me->take_kept(count * size)) {
      std::memset(block, 0, count * size);
      return me->remember(block, count * size);
    }
    return me->remember(me->original_.calloc(me->original_.ctx, count, size), count * size);
  }
  static void* hook_realloc(void* ctx, void* block, size_t size) {
    RawMemoryReuse* me = self(ctx);
    std::lock_guard<std::mutex> guard(me->mutex_);
    me->sizes_.erase(block);
    return me->remember(me->original_.realloc(me->original_.ctx, block, size), size);
  }
  static void hook_free(void* ctx, void* block) {
    RawMemoryReuse* me = self(ctx);
    std::lock_guard<std::mutex> guard(me->mutex_);
    auto known = me->sizes_.find(block);
    if (block != nullptr && block == me->target_ && known != me->sizes_.end() &&
        me->kept_ == nullptr) {
      me->kept_ = block;
      me->kept_size_ = known->second;
      me->target_ = nullptr;
      me->sizes_.erase(known);
      return;
    }
    if (known != me->sizes_.end()) me->sizes_.erase(known);
    me->original_.free(me->original_.ctx, block);
  }

  PyMemAllocatorEx original_{};
  std::mutex mutex_;
  std::unordered_map<void*, size_t> sizes_;
  void* target_ = nullptr;
  void* kept_ = nullptr;
  size_t kept_size_ = 0;
};

TEST_F(ThreadTableTest, ReusedThreadStatePointerFindsTheOldRecordUntilRemoved) {
  PyInterpreterState* interp = PyThreadState_Get()->interp;
  RawMemoryReuse reuse;
  PyThreadState* ended = PyThreadState_New(interp);
  ASSERT_NE(ended, nullptr);
  ThreadData* old_record = insert_thread_data(&table_, ended);
  ASSERT_NE(old_record, nullptr);
  Ref old_name = Ref::steal(PyUnicode_FromString("ended thread"));
  old_record->thread_name = old_name;
  reuse.reuse_next(ended);
  PyThreadState_Clear(ended);
  PyThreadState_Delete(ended);

  PyThreadState* started = PyThreadState_New(interp);
  ASSERT_NE(started, nullptr);
  extra_states_.push_back(started);
  ASSERT_EQ(started, ended) << "the interpreter did not reuse the thread state's memory";

  // The table cannot tell the threads apart: the new one finds the ended one's record...
  EXPECT_EQ(find_thread_data(&table_, started), old_record);
  EXPECT_EQ(insert_thread_data(&table_, started), old_record);
  EXPECT_TRUE(old_record->thread_name.is(old_name.get()));
  EXPECT_EQ(table_.num_entries, 1u);
  // ...until that record is removed; then it gets a fresh one.
  remove_thread_data(&table_, started);
  EXPECT_EQ(find_thread_data(&table_, started), nullptr);
  ThreadData* fresh = insert_thread_data(&table_, started);
  ASSERT_NE(fresh, nullptr);
  EXPECT_TRUE(fresh->thread_name.is_none());
  EXPECT_EQ(fresh->tstate, started);
}

TEST_F(ThreadTableTest, CachedCurrentRecordIsNeverARemovedOne) {
  PyThreadState* ts = PyThreadState_Get();
  ThreadData* first = current_thread_data_or_insert(&table_);
  ASSERT_NE(first, nullptr);
  EXPECT_EQ(current_thread_data_or_insert(&table_), first);
  first->line_range_start = 99;

  remove_thread_data(&table_, ts);
  ThreadData* after_remove = current_thread_data_or_insert(&table_);
  ASSERT_NE(after_remove, nullptr);
  EXPECT_EQ(after_remove->line_range_start, -1);  // a fresh record, not the freed one
  EXPECT_EQ(find_thread_data(&table_, ts), after_remove);

  after_remove->line_range_start = 98;
  clear_thread_table(&table_);
  ThreadData* after_clear = current_thread_data_or_insert(&table_);
  ASSERT_NE(after_clear, nullptr);
  EXPECT_EQ(after_clear->line_range_start, -1);
  EXPECT_EQ(find_thread_data(&table_, ts), after_clear);
}

TEST_F(ThreadTableTest, CacheAnswersForTheTableItWasAskedFor) {
  CU_HashTable other{};
  init_thread_table(&other);
  ThreadData* in_mine = current_thread_data_or_insert(&table_);
  ThreadData* in_other = current_thread_data_or_insert(&other);
  ASSERT_NE(in_mine, nullptr);
  ASSERT_NE(in_other, nullptr);
  EXPECT_NE(in_mine, in_other);
  EXPECT_EQ(find_thread_data(&other, PyThreadState_Get()), in_other);
  EXPECT_EQ(current_thread_data_or_insert(&table_), in_mine);
  clear_thread_table(&other);
  CU_DeleteHashTable(&other);
}

TEST_F(ThreadTableTest, RemovingAnotherThreadsRecordDoesNotLoseThisThreadsRecord) {
  PyThreadState* other = new_state();
  ThreadData* mine = current_thread_data_or_insert(&table_);
  insert_thread_data(&table_, other);
  remove_thread_data(&table_, other);
  EXPECT_EQ(current_thread_data_or_insert(&table_), mine);
  EXPECT_EQ(table_.num_entries, 1u);
}

// ---- Thread states as Python ints --------------------------------------------------------

class ThreadIdTest : public coretest::PythonTest {};

TEST_F(ThreadIdTest, IdsRoundTripSixtyFourBitPointers) {
  const uintptr_t samples[] = {
      reinterpret_cast<uintptr_t>(PyThreadState_Get()),
      static_cast<uintptr_t>(0x00007f1234567890ULL),
      static_cast<uintptr_t>(0xffff800012345670ULL),  // the top bit set
      static_cast<uintptr_t>(0x0000000100000008ULL),  // beyond 32 bits only by one bit
  };
  for (uintptr_t value : samples) {
    auto* ts = reinterpret_cast<PyThreadState*>(value);
    Ref id = Ref::steal(id_for_tstate_ptr(ts));
    ASSERT_TRUE(id);
    ASSERT_TRUE(PyLong_Check(id.get()));
    EXPECT_EQ(PyLong_AsUnsignedLongLong(id.get()), static_cast<unsigned long long>(value));
    EXPECT_EQ(tstate_ptr_for_id(id.get()), ts);
    EXPECT_EQ(PyErr_Occurred(), nullptr);
  }
}

TEST_F(ThreadIdTest, IdOfANonIntIsNullWithAnError) {
  Ref text = Ref::steal(PyUnicode_FromString("1234"));
  EXPECT_EQ(tstate_ptr_for_id(text.get()), nullptr);
  EXPECT_TRUE(PyErr_ExceptionMatches(PyExc_TypeError));
  PyErr_Clear();
}

// ---- Thread identity and the thread mutex ------------------------------------------------

class ThreadMutexTest : public coretest::PythonTest {};

TEST_F(ThreadMutexTest, IdentityIsTheInterpretersThreadIdent) {
  EXPECT_NE(gGetThreadIdentFunc, nullptr);
  EXPECT_EQ(get_thread_ident(), PyThread_get_thread_ident());
  auto* saved = gGetThreadIdentFunc;
  gGetThreadIdentFunc = nullptr;
  EXPECT_EQ(get_thread_ident(), 1u);
  gGetThreadIdentFunc = saved;
}

TEST_F(ThreadMutexTest, NullMutexCountsAsAcquiredAndKeepsErrno) {
  errno = coretest::kMarkerErrno;
  EXPECT_EQ(acquire_thread_mutex(nullptr, 1), 1);
  EXPECT_EQ(acquire_thread_mutex(nullptr, 0), 1);
  release_thread_mutex(nullptr);
  EXPECT_EQ(errno, coretest::kMarkerErrno);
}

TEST_F(ThreadMutexTest, AcquireAndReleaseKeepErrno) {
  PyThread_type_lock lock = allocate_thread_mutex();
  ASSERT_NE(lock, nullptr);
  errno = coretest::kMarkerErrno;
  EXPECT_EQ(acquire_thread_mutex(lock, 0), 1);
  EXPECT_EQ(errno, coretest::kMarkerErrno);
  EXPECT_EQ(acquire_thread_mutex(lock, 0), 0);  // held: a try fails
  EXPECT_EQ(errno, coretest::kMarkerErrno);
  release_thread_mutex(lock);
  EXPECT_EQ(errno, coretest::kMarkerErrno);
  EXPECT_EQ(acquire_thread_mutex(lock, 0), 1);  // the release was real
  release_thread_mutex(lock);
  PyThread_free_lock(lock);
}

// The holder of the mutex needs the interpreter lock to finish its work and let go; a waiter
// that kept the interpreter lock while waiting would never be let in.
TEST_F(ThreadMutexTest, WaitingReleasesTheInterpreterLockAndKeepsErrno) {
  PyThread_type_lock lock = allocate_thread_mutex();
  ASSERT_NE(lock, nullptr);
  std::atomic<bool> holding{false};
  std::atomic<bool> ran_python{false};
  std::thread holder([&] {
    PyThread_acquire_lock(lock, WAIT_LOCK);
    holding = true;
    PyGILState_STATE gil = PyGILState_Ensure();
    Ref value = Ref::steal(PyLong_FromLong(1));
    ran_python = static_cast<bool>(value);
    value.reset();
    PyGILState_Release(gil);
    PyThread_release_lock(lock);
  });
  while (!holding) std::this_thread::yield();
  errno = coretest::kMarkerErrno;
  EXPECT_EQ(acquire_thread_mutex(lock, 1), 1);
  EXPECT_EQ(errno, coretest::kMarkerErrno);
  EXPECT_TRUE(ran_python);
  release_thread_mutex(lock);
  PyThreadState* saved = PyEval_SaveThread();
  holder.join();
  PyEval_RestoreThread(saved);
  PyThread_free_lock(lock);
}

}  // namespace
