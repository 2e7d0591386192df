// test_tracercore.cpp: the global tracer record: what init stores and which defaults it
// restores, what reset keeps and what it forgets, what destroy adds, and the bookkeeping of
// the frame at which the calling thread stands.
#include "core/tracercore.h"

#include <gtest/gtest.h>

#include <string>

#include "core/exception_dispatch.h"
#include "core/thread_policy.h"
#include "tracer_fixture.h"

namespace {

using coretest::refs;

constexpr const char* kServerSide = R"(
import builtins, io
hook_calls = []
def install_thread_hooks_cb(flag):
    hook_calls.append(flag)
def idle_cb(): pass
def line_cb(frame, changed): pass
def return_cb(frame, value, changed): pass
def exception_cb(frame, exc, changed): pass
def quit_cb(): pass
def trace_dispatch(frame, event, arg): return trace_dispatch
default_import = builtins.__import__
# init puts the module's __import__ into the builtins: this one hands every import on.
def import_hook(*args, **kwargs):
    return default_import(*args, **kwargs)
debug_file = io.StringIO()
internal_modules = {}
)";

class TracerCoreTest : public coretest::TracerStateTest {
 protected:
  void SetUp() override {
    TracerStateTest::SetUp();
    server_ = coretest::make_namespace(kServerSide);
    module_ = Ref::steal(PyModule_New("core_test_module"));
    ASSERT_TRUE(module_);
    ASSERT_EQ(PyObject_SetAttrString(module_.get(), "trace_dispatch", cb("trace_dispatch")), 0);
    ASSERT_EQ(PyObject_SetAttrString(module_.get(), "__import__", cb("import_hook")), 0);
  }
  void TearDown() override {
    set_dprintf_file(nullptr);
    TracerStateTest::TearDown();
  }
  PyObject* cb(const char* name) { return coretest::item(server_.get(), name); }
  int init(float idle_period = 0.5f, int exception_mode = kExcUnhandledStop) {
    return __tracer_init(module_.get(), idle_period, exception_mode, cb("install_thread_hooks_cb"),
                         cb("idle_cb"), cb("line_cb"), cb("return_cb"), cb("exception_cb"),
                         cb("quit_cb"), Py_None, cb("default_import"), cb("debug_file"),
                         cb("internal_modules"));
  }
  std::string debug_text() {
    Ref value = Ref::steal(PyObject_CallMethod(cb("debug_file"), "getvalue", nullptr));
    const char* text = value ? PyUnicode_AsUTF8(value.get()) : nullptr;
    return text != nullptr ? text : "";
  }
  Ref hook_calls_repr() { return Ref::steal(PyObject_Repr(cb("hook_calls"))); }

  Ref server_;
  Ref module_;
};

TEST_F(TracerCoreTest, InitStoresTheArguments) {
  const Py_ssize_t line_cb_refs = refs(cb("line_cb"));
  ASSERT_EQ(init(0.25f, kExcAlwaysStop), 1);
  EXPECT_EQ(gSelf.idle_period, 0.25f);
  EXPECT_EQ(gSelf.exception_mode, kExcAlwaysStop);
  EXPECT_TRUE(gSelf.install_thread_hooks_cb.is(cb("install_thread_hooks_cb")));
  EXPECT_TRUE(gSelf.idle_cb.is(cb("idle_cb")));
  EXPECT_TRUE(gSelf.line_cb.is(cb("line_cb")));
  EXPECT_TRUE(gSelf.return_cb.is(cb("return_cb")));
  EXPECT_TRUE(gSelf.exception_cb.is(cb("exception_cb")));
  EXPECT_TRUE(gSelf.quit_cb.is(cb("quit_cb")));
  EXPECT_TRUE(gSelf.import_cb.is_none());
  EXPECT_TRUE(gSelf.default_import.is(cb("default_import")));
  EXPECT_TRUE(gSelf.internal_modules_map.is(cb("internal_modules")));
  EXPECT_TRUE(gSelf.module.is(module_.get()));
  EXPECT_TRUE(gSelf.trace_dispatch.is(cb("trace_dispatch")));
  EXPECT_EQ(gDPrintfFile, cb("debug_file"));
  EXPECT_EQ(refs(cb("line_cb")), line_cb_refs + 1);  // held by a reference of its own

  Ref sys = Ref::steal(PyImport_ImportModule("sys"));
  Ref settrace = Ref::steal(PyObject_GetAttrString(sys.get(), "settrace"));
  Ref exc_info = Ref::steal(PyObject_GetAttrString(sys.get(), "exc_info"));
  EXPECT_TRUE(gSelf.sys_module.is(sys.get()));
  EXPECT_TRUE(gSelf.sys_settrace.is(settrace.get()));
  EXPECT_TRUE(gSelf.sys_exc_info.is(exc_info.get()));
  EXPECT_EQ(debug_text().rfind("INIT CORE\n", 0), 0u) << debug_text();
}

// Threads may wait on the mutex, or the caller itself hold it (init from a callback): a
// repeated init keeps both the mutex and its owner, so no waiter is lost and the holder's
// release still works.
TEST_F(TracerCoreTest, RepeatedInitKeepsTheMutexAndItsOwner) {
  ASSERT_EQ(init(), 1);
  PyThread_type_lock mutex = gSelf.thread_mutex;
  ASSERT_EQ(acquire_selvane_mutex(), 1);
  ASSERT_EQ(init(), 1);
  EXPECT_EQ(gSelf.thread_mutex, mutex);
  EXPECT_EQ(gSelf.selvane_mutex_owner, get_thread_ident());
  release_selvane_mutex();
  EXPECT_EQ(gSelf.selvane_mutex_owner, kNoMutexOwner);
  EXPECT_EQ(PyThread_acquire_lock(mutex, NOWAIT_LOCK), 1) << "the mutex was left held";
  PyThread_release_lock(mutex);
}

TEST_F(TracerCoreTest, InitRestoresTheDefaults) {
  gSelf.trace_started = 1;
  gSelf.in_idle = 1;
  gSelf.autoquit = 0;
  gSelf.debug_all_threads = 0;
  gSelf.idle_tick = 7;
  gSelf.idle_tick_limit = 3;
  gSelf.next_idle_time = 12345;
  gSelf.instruction_count = 50;
  gSelf.import_hook_calls = 9;
  gSelf.spare_ref = Ref::none();
  gSelf.always_stop_excepts = Ref::steal(PyTuple_New(0));
  gSelf.debug_thread_cb = Ref::borrow(cb("idle_cb"));
  ASSERT_EQ(init(), 1);
  EXPECT_EQ(gSelf.trace_started, 0);
  EXPECT_EQ(gSelf.in_idle, 0);
  EXPECT_EQ(gSelf.autoquit, 1);
  EXPECT_EQ(gSelf.debug_all_threads, 1);
  EXPECT_EQ(gSelf.idle_tick, 0);
  EXPECT_EQ(gSelf.idle_tick_limit, 10);
  EXPECT_EQ(gSelf.next_idle_time, 0);
  EXPECT_EQ(gSelf.instruction_count, 0u);
  EXPECT_EQ(gSelf.import_hook_calls, 0u);
  EXPECT_NE(gSelf.thread_mutex, nullptr);
  EXPECT_FALSE(gSelf.spare_ref);
  EXPECT_FALSE(gSelf.always_stop_excepts);
  EXPECT_FALSE(gSelf.debug_thread_cb);
  EXPECT_TRUE(gSelf.installed_import_hook.is(cb("import_hook")));  // installed anew
  ASSERT_TRUE(gSelf.new_imports);
  EXPECT_TRUE(PyList_CheckExact(gSelf.new_imports.get()));
  EXPECT_EQ(PyList_GET_SIZE(gSelf.new_imports.get()), 0);
}

TEST_F(TracerCoreTest, InitEmptiesTheThreadTableAndReleasesItsRecords) {
  Ref held = Ref::steal(PyList_New(0));
  const Py_ssize_t before = refs(held.get());
  ThreadData* data = insert_thread_data(&gSelf.thread_table, PyThreadState_Get());
  ASSERT_NE(data, nullptr);
  data->curr_frame = held;
  ASSERT_EQ(init(), 1);
  EXPECT_EQ(gSelf.thread_table.num_entries, 0u);
  EXPECT_EQ(refs(held.get()), before);
}

TEST_F(TracerCoreTest, ResetKeepsTheCallbacksAndClearsTheThreadTable) {
  ASSERT_EQ(init(0.5f, kExcUnhandledStop), 1);
  Ref held = Ref::steal(PyList_New(0));
  const Py_ssize_t before = refs(held.get());
  insert_thread_data(&gSelf.thread_table, PyThreadState_Get())->bot_frame = held;
  gSelf.autoquit = 0;
  gSelf.debug_all_threads = 0;
  gSelf.debug_thread_cb = Ref::borrow(cb("idle_cb"));
  unsigned long identity = 5;
  int is_new = 0;
  CU_CreateHashEntry(&gSelf.debug_thread_map, &identity, &is_new);
  gSelf.always_stop_excepts = Ref::steal(PyTuple_New(0));
  gSelf.never_stop_excepts = Ref::steal(PyTuple_New(0));
  gSelf.ignored_exception_handlers = Ref::steal(PyDict_New());
  PyList_Append(gSelf.new_imports.get(), Py_None);

  __tracer_reset();

  EXPECT_EQ(gSelf.thread_table.num_entries, 0u);
  EXPECT_EQ(refs(held.get()), before);
  EXPECT_TRUE(gSelf.line_cb.is(cb("line_cb")));
  EXPECT_TRUE(gSelf.return_cb.is(cb("return_cb")));
  EXPECT_TRUE(gSelf.exception_cb.is(cb("exception_cb")));
  EXPECT_TRUE(gSelf.install_thread_hooks_cb.is(cb("install_thread_hooks_cb")));
  EXPECT_TRUE(gSelf.trace_dispatch.is(cb("trace_dispatch")));
  EXPECT_EQ(gSelf.idle_period, 0.5f);
  EXPECT_EQ(gSelf.exception_mode, kExcUnhandledStop);
  EXPECT_EQ(gSelf.autoquit, 1);
  EXPECT_EQ(gSelf.debug_all_threads, 1);
  EXPECT_FALSE(gSelf.debug_thread_cb);
  EXPECT_EQ(gSelf.debug_thread_map.num_entries, 0u);
  EXPECT_FALSE(gSelf.always_stop_excepts);
  EXPECT_FALSE(gSelf.never_stop_excepts);
  EXPECT_FALSE(gSelf.ignored_exception_handlers);
  ASSERT_TRUE(gSelf.new_imports);
  EXPECT_EQ(PyList_Size(gSelf.new_imports.get()), 0);
  // Tracing was stopped on the way: the server side was told to drop its thread hooks.
  Ref calls = hook_calls_repr();
  EXPECT_STREQ(PyUnicode_AsUTF8(calls.get()), "[0]");
  EXPECT_EQ(gSelf.trace_started, 0);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

TEST_F(TracerCoreTest, ResetForgetsInjectedExceptionsWithTheirThreads) {
  ASSERT_EQ(init(), 1);
  ThreadData* data = insert_thread_data(&gSelf.thread_table, PyThreadState_Get());
  ASSERT_NE(data, nullptr);
  Ref exc = Ref::steal(PyObject_CallFunction(PyExc_RuntimeError, "s", "injected"));
  ASSERT_EQ(__tracer_set_pending_exception(data, exc.get()), 1);
  ASSERT_EQ(gSelf.pending_exception_count, 1);
  __tracer_reset();
  // No record is left to hold one, so no event may have to look for it.
  EXPECT_EQ(gSelf.pending_exception_count, 0);
}

TEST_F(TracerCoreTest, ForgettingAThreadGivesUpItsInjectedException) {
  ASSERT_EQ(init(), 1);
  PyThreadState* ts = PyThreadState_Get();
  ThreadData* data = insert_thread_data(&gSelf.thread_table, ts);
  ASSERT_NE(data, nullptr);
  Ref exc = Ref::steal(PyObject_CallFunction(PyExc_RuntimeError, "s", "injected"));
  ASSERT_EQ(__tracer_set_pending_exception(data, exc.get()), 1);
  Py_ssize_t held = Py_REFCNT(exc.get());
  // What thread_exiting and the thread start hook do with a thread's record.
  __tracer_forget_thread(ts);
  EXPECT_EQ(find_thread_data(&gSelf.thread_table, ts), nullptr);
  EXPECT_EQ(gSelf.pending_exception_count, 0);
  EXPECT_EQ(Py_REFCNT(exc.get()), held - 1);
  __tracer_forget_thread(ts);  // no record: nothing to do
  EXPECT_EQ(gSelf.pending_exception_count, 0);
}

TEST_F(TracerCoreTest, DestroyAlsoReleasesTheSpareReference) {
  ASSERT_EQ(init(), 1);
  Ref spare = Ref::steal(PyList_New(0));
  const Py_ssize_t before = refs(spare.get());
  gSelf.spare_ref = spare;
  __tracer_destroy();
  EXPECT_FALSE(gSelf.spare_ref);
  EXPECT_EQ(refs(spare.get()), before);
  EXPECT_TRUE(gSelf.line_cb.is(cb("line_cb")));  // destroy resets, it does not forget init
  EXPECT_EQ(debug_text().find("DESTROY REACHED\n") != std::string::npos, true) << debug_text();
}

// ---- The current frame of a thread ------------------------------------------------------

class CurrFrameTest : public coretest::TracerStateTest {};

TEST_F(CurrFrameTest, ClearingOnAThreadWithoutRecordCreatesItWithNone) {
  ASSERT_EQ(find_thread_data(&gSelf.thread_table, PyThreadState_Get()), nullptr);
  __tracer_clear_curr_frame();
  ThreadData* data = find_thread_data(&gSelf.thread_table, PyThreadState_Get());
  ASSERT_NE(data, nullptr);
  EXPECT_TRUE(data->curr_frame.is_none());
  EXPECT_EQ(gSelf.thread_table.num_entries, 1u);
}

TEST_F(CurrFrameTest, SettingHoldsANewReferenceAndReleasesThePreviousOne) {
  Ref globals = coretest::make_namespace(
      "import sys\n"
      "def capture():\n"
      "    return sys._getframe()\n"
      "first = capture()\n"
      "second = capture()\n");
  PyObject* first = coretest::item(globals.get(), "first");
  PyObject* second = coretest::item(globals.get(), "second");
  ASSERT_TRUE(PyFrame_Check(first));
  const Py_ssize_t first_refs = refs(first);
  const Py_ssize_t second_refs = refs(second);

  __tracer_set_curr_frame(first);
  ThreadData* data = find_thread_data(&gSelf.thread_table, PyThreadState_Get());
  ASSERT_NE(data, nullptr);
  EXPECT_TRUE(data->curr_frame.is(first));
  EXPECT_EQ(refs(first), first_refs + 1);

  __tracer_set_curr_frame(second);
  EXPECT_TRUE(data->curr_frame.is(second));
  EXPECT_EQ(refs(first), first_refs);
  EXPECT_EQ(refs(second), second_refs + 1);

  __tracer_clear_curr_frame();
  EXPECT_TRUE(data->curr_frame.is_none());
  EXPECT_EQ(refs(second), second_refs);
}

}  // namespace
