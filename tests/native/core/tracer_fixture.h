// tracer_fixture.h: a fixture for tests that work on the global tracer record gSelf.
//
// gSelf lives for the whole process and every test of a run shares it, so each test starts
// from the same blank run-control state and leaves it so: no debug-thread callback and an
// empty decision cache, an empty thread table, the selvane mutex free, tracing off, no debug
// file, no pending injected exception.
#pragma once

#include <Python.h>
#include <gtest/gtest.h>

#include "core/tracercore.h"
#include "core_test_support.h"
#include "support/dprintf.h"
#include "threads/threadops.h"

namespace coretest {

class TracerStateTest : public PythonTest {
 protected:
  void SetUp() override {
    PythonTest::SetUp();
    if (gSelf.thread_mutex == nullptr) gSelf.thread_mutex = allocate_thread_mutex();
    ASSERT_NE(gSelf.thread_mutex, nullptr);
    blank();
  }
  void TearDown() override {
    EXPECT_EQ(gSelf.selvane_mutex_owner, kNoMutexOwner) << "the selvane mutex was left held";
    // A mutex left held would block the next test for ever; free it either way.
    if (gSelf.selvane_mutex_owner != kNoMutexOwner) {
      gSelf.selvane_mutex_owner = kNoMutexOwner;
      PyThread_release_lock(gSelf.thread_mutex);
    }
    blank();
    PythonTest::TearDown();
  }

 private:
  static void blank() {
    gSelf.debug_thread_cb.reset();
    CU_DeleteHashTable(&gSelf.debug_thread_map);
    CU_InitHashTable(&gSelf.debug_thread_map, sizeof(unsigned long));
    clear_thread_table(&gSelf.thread_table);
    gSelf.pending_exception_count = 0;
    gSelf.trace_started = 0;
    gSelf.debug_all_threads = 1;
    gSelf.selvane_mutex_owner = kNoMutexOwner;
    set_dprintf_file(nullptr);
  }
};

}  // namespace coretest
