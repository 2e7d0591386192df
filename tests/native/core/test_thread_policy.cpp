// test_thread_policy.cpp: which threads enter the debugger: the per-thread answer of the
// debug-thread callback and its cache, and the selvane mutex's owner bookkeeping.
#include "core/thread_policy.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <thread>

#include "core/tracercore.h"
#include "tracer_fixture.h"

namespace {

constexpr const char* kCallbacks = R"(
calls = []
def answer_zero(identity):
    calls.append(identity)
    return 0
def answer_one(identity):
    calls.append(identity)
    return 1
def answer_two(identity):
    calls.append(identity)
    return 2
def refuse(identity):
    calls.append(identity)
    raise RuntimeError('policy failure')
def clobber_errno(identity):
    calls.append(identity)
    set_errno()
    return 1
)";

class ThreadPolicyTest : public coretest::TracerStateTest {
 protected:
  void SetUp() override {
    TracerStateTest::SetUp();
    globals_ = coretest::make_namespace(kCallbacks);
  }
  void use_callback(const char* name) {
    gSelf.debug_thread_cb = Ref::borrow(coretest::item(globals_.get(), name));
  }
  Py_ssize_t calls() { return PyList_Size(coretest::item(globals_.get(), "calls")); }

  Ref globals_;
};

TEST_F(ThreadPolicyTest, WithoutCallbackEveryThreadIsDebuggedAndNothingIsCached) {
  for (unsigned long identity : {1ul, 2ul, 77ul, get_thread_ident()}) {
    EXPECT_EQ(__should_debug_thread(identity), 1) << identity;
  }
  EXPECT_EQ(gSelf.debug_thread_map.num_entries, 0u);
}

TEST_F(ThreadPolicyTest, ZeroAnswerIsCachedAndAskedOnce) {
  use_callback("answer_zero");
  EXPECT_EQ(__should_debug_thread(5), 0);
  EXPECT_EQ(__should_debug_thread(5), 0);
  EXPECT_EQ(__should_debug_thread(5), 0);
  EXPECT_EQ(calls(), 1);
  EXPECT_EQ(gSelf.debug_thread_map.num_entries, 1u);
  // Each thread is asked for itself.
  EXPECT_EQ(__should_debug_thread(6), 0);
  EXPECT_EQ(calls(), 2);
}

// Identities are reused by later threads; a refused thread is never traced, so nothing
// clears its answer. The answer belongs to the thread state it was given for: another thread
// state with the same identity is asked afresh.
TEST_F(ThreadPolicyTest, AnswerGivenToAnEarlierThreadStateIsAskedAgain) {
  use_callback("answer_zero");
  EXPECT_EQ(__should_debug_thread(5), 0);
  EXPECT_EQ(calls(), 1);
  PyThreadState* later = PyThreadState_New(PyThreadState_Get()->interp);
  ASSERT_NE(later, nullptr);
  PyThreadState* mine = PyThreadState_Swap(later);
  EXPECT_EQ(__should_debug_thread(5), 0);
  EXPECT_EQ(__should_debug_thread(5), 0);
  PyThreadState_Swap(mine);
  EXPECT_EQ(calls(), 2);
  EXPECT_EQ(gSelf.debug_thread_map.num_entries, 1u);
  PyThreadState_Clear(later);
  PyThreadState_Delete(later);
  // Back in the first thread state, the entry now holds the later thread's answer.
  EXPECT_EQ(__should_debug_thread(5), 0);
  EXPECT_EQ(calls(), 3);
}

TEST_F(ThreadPolicyTest, CallbackGetsTheIdentityAsAnInt) {
  use_callback("answer_one");
  const unsigned long identity = 0xfedcba9876543210ul;
  EXPECT_EQ(__should_debug_thread(identity), 1);
  PyObject* first = PyList_GetItem(coretest::item(globals_.get(), "calls"), 0);
  ASSERT_NE(first, nullptr);
  ASSERT_TRUE(PyLong_Check(first));
  EXPECT_EQ(PyLong_AsUnsignedLong(first), identity);
}

TEST_F(ThreadPolicyTest, RaisingCallbackMeansDebugClearsTheErrorAndIsNotAskedAgain) {
  use_callback("refuse");
  EXPECT_EQ(__should_debug_thread(9), 1);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
  EXPECT_EQ(__should_debug_thread(9), 1);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
  EXPECT_EQ(calls(), 1);
}

TEST_F(ThreadPolicyTest, FirstAnswerIsTheRawNumberLaterOnesTheCachedFlag) {
  use_callback("answer_two");
  EXPECT_EQ(__should_debug_thread(3), 2);
  EXPECT_EQ(__should_debug_thread(3), 1);
  EXPECT_EQ(calls(), 1);
}

TEST_F(ThreadPolicyTest, ClearingTheCacheMakesItAskAgain) {
  use_callback("answer_zero");
  EXPECT_EQ(__should_debug_thread(4), 0);
  EXPECT_EQ(__should_debug_thread(8), 0);
  __clear_should_debug_thread_cache(4);
  EXPECT_EQ(gSelf.debug_thread_map.num_entries, 1u);
  EXPECT_EQ(__should_debug_thread(4), 0);
  EXPECT_EQ(calls(), 3);
  EXPECT_EQ(__should_debug_thread(8), 0);  // the other thread's answer stayed cached
  EXPECT_EQ(calls(), 3);
  __clear_should_debug_thread_cache(12345);  // unknown: nothing happens
  EXPECT_EQ(gSelf.debug_thread_map.num_entries, 2u);
}

TEST_F(ThreadPolicyTest, ErrnoSurvivesTheCallback) {
  use_callback("clobber_errno");
  // The callback really changes errno when called directly.
  errno = coretest::kMarkerErrno;
  Ref direct = Ref::steal(PyObject_CallFunction(gSelf.debug_thread_cb.get(), "k", 1ul));
  ASSERT_TRUE(direct);
  EXPECT_EQ(errno, coretest::kClobberedErrno);

  errno = coretest::kMarkerErrno;
  EXPECT_EQ(__should_debug_thread(21), 1);
  EXPECT_EQ(errno, coretest::kMarkerErrno);
  EXPECT_EQ(calls(), 2);
}

// ---- The selvane mutex --------------------------------------------------------------------

class SelvaneMutexTest : public coretest::TracerStateTest {};

TEST_F(SelvaneMutexTest, AcquireRecordsTheOwnerAndReleaseFreesIt) {
  ASSERT_NE(acquire_selvane_mutex(), 0);
  EXPECT_EQ(gSelf.selvane_mutex_owner, get_thread_ident());
  EXPECT_EQ(PyThread_acquire_lock(gSelf.thread_mutex, NOWAIT_LOCK), 0);  // really held
  release_selvane_mutex();
  EXPECT_EQ(gSelf.selvane_mutex_owner, kNoMutexOwner);
  ASSERT_EQ(PyThread_acquire_lock(gSelf.thread_mutex, NOWAIT_LOCK), 1);  // really free
  PyThread_release_lock(gSelf.thread_mutex);
}

TEST_F(SelvaneMutexTest, ReleaseByAThreadThatDoesNotHoldItIsIgnored) {
  ASSERT_NE(acquire_selvane_mutex(), 0);
  const unsigned long owner = gSelf.selvane_mutex_owner;
  unsigned long other_identity = 0;
  std::thread other([&] {
    PyGILState_STATE gil = PyGILState_Ensure();
    other_identity = get_thread_ident();
    release_selvane_mutex();
    PyGILState_Release(gil);
  });
  PyThreadState* saved = PyEval_SaveThread();
  other.join();
  PyEval_RestoreThread(saved);
  EXPECT_NE(other_identity, owner);
  EXPECT_EQ(gSelf.selvane_mutex_owner, owner);
  EXPECT_EQ(PyThread_acquire_lock(gSelf.thread_mutex, NOWAIT_LOCK), 0);  // still held
  release_selvane_mutex();
  EXPECT_EQ(gSelf.selvane_mutex_owner, kNoMutexOwner);
}

TEST_F(SelvaneMutexTest, ReleaseWhenNobodyHoldsItChangesNothing) {
  release_selvane_mutex();
  EXPECT_EQ(gSelf.selvane_mutex_owner, kNoMutexOwner);
  // The lock was not released a second time: one acquire takes it, the next try fails.
  ASSERT_EQ(PyThread_acquire_lock(gSelf.thread_mutex, NOWAIT_LOCK), 1);
  EXPECT_EQ(PyThread_acquire_lock(gSelf.thread_mutex, NOWAIT_LOCK), 0);
  PyThread_release_lock(gSelf.thread_mutex);
}

}  // namespace
