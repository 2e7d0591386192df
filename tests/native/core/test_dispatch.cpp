// test_dispatch.cpp: what the trace function guarantees to the program whatever it decides:
// errno is the program's on every way out, and an exception injected with raise_exception
// comes out of the next event of its own thread, once.
//
// Each case calls c_dispatch the way the interpreter does, from inside a running Python
// function with that function's frame. The debug file used here clobbers errno from its
// write method, so every path that prints shows whether errno is put back.
#include "core/dispatch.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <string>

#include "core/exception_dispatch.h"
#include "core/tracercore.h"
#include "tracer_fixture.h"

namespace {

using coretest::kMarkerErrno;
using coretest::refs;

constexpr const char* kProgram = R"(
class ClobberingFile:
    def __init__(self):
        self.parts = []
    def write(self, text):
        set_errno()
        self.parts.append(text)
        return len(text)
    def flush(self):
        set_errno()

class Injected(Exception):
    def __init__(self, *args):
        set_errno()
        super().__init__(*args)

def ignore_everyone(identity):
    return 0

def host():
    return probe()

def host_in_except():
    try:
        raise KeyError('handled')
    except KeyError:
        return probe()
)";

class DispatchTest : public coretest::TracerStateTest {
 protected:
  void SetUp() override {
    TracerStateTest::SetUp();
    program_ = coretest::make_namespace(kProgram);
    file_ = Ref::steal(PyObject_CallNoArgs(coretest::item(program_.get(), "ClobberingFile")));
    ASSERT_TRUE(file_);
  }
  void TearDown() override {
    set_dprintf_file(nullptr);
    TracerStateTest::TearDown();
  }

  // Calls c_dispatch for a line event from inside `host_name`; returns its result and the
  // errno seen right after it, and keeps whatever exception it left pending.
  struct Outcome {
    int result = 99;
    int errno_after = 0;
    Ref pending;
    bool ran = false;
  };
  Outcome dispatch_line_event(const char* host_name = "host") {
    Outcome outcome;
    outcome.ran = coretest::run_in_frame(program_.get(), host_name, [&](PyFrameObject* frame) {
      errno = kMarkerErrno;
      outcome.result = c_dispatch(nullptr, frame, PyTrace_LINE, Py_None);
      outcome.errno_after = errno;
      outcome.pending = coretest::take_pending_exception();
    });
    return outcome;
  }
  std::string printed() {
    Ref parts = Ref::steal(PyObject_GetAttrString(file_.get(), "parts"));
    Ref empty = Ref::steal(PyUnicode_FromString(""));
    Ref joined = parts ? Ref::steal(PyUnicode_Join(empty.get(), parts.get())) : Ref();
    const char* text = joined ? PyUnicode_AsUTF8(joined.get()) : nullptr;
    return text != nullptr ? text : "";
  }
  ThreadData* my_record() {
    ThreadData* data = insert_thread_data(&gSelf.thread_table, PyThreadState_Get());
    EXPECT_NE(data, nullptr);
    return data;
  }

  Ref program_;
  Ref file_;
};

TEST_F(DispatchTest, ErrnoIsRestoredWhenTracingIsOff) {
  set_dprintf_file(file_.get());
  Outcome outcome = dispatch_line_event();
  ASSERT_TRUE(outcome.ran);
  EXPECT_EQ(outcome.result, 0);
  EXPECT_FALSE(outcome.pending);
  EXPECT_EQ(outcome.errno_after, kMarkerErrno);
  // The clobbering write did run inside the event.
  EXPECT_NE(printed().find("trace_dispatch called while not tracing"), std::string::npos)
      << printed();
  EXPECT_EQ(gSelf.selvane_mutex_owner, kNoMutexOwner);
}

TEST_F(DispatchTest, ErrnoIsRestoredOnARecursiveEvent) {
  set_dprintf_file(file_.get());
  gSelf.selvane_mutex_owner = get_thread_ident();
  Outcome outcome = dispatch_line_event();
  gSelf.selvane_mutex_owner = kNoMutexOwner;
  ASSERT_TRUE(outcome.ran);
  EXPECT_EQ(outcome.result, 0);
  EXPECT_EQ(outcome.errno_after, kMarkerErrno);
  EXPECT_EQ(printed(), "recursive c_dispatch\n");
}

TEST_F(DispatchTest, ErrnoIsRestoredForAThreadIgnoredByPolicy) {
  set_dprintf_file(file_.get());
  gSelf.debug_thread_cb = Ref::borrow(coretest::item(program_.get(), "ignore_everyone"));
  Outcome outcome = dispatch_line_event();
  ASSERT_TRUE(outcome.ran);
  EXPECT_EQ(outcome.result, 0);
  EXPECT_EQ(outcome.errno_after, kMarkerErrno);
  EXPECT_EQ(printed(), "ignore thread by policy\n");
}

TEST_F(DispatchTest, ErrnoIsRestoredForAThreadIgnoredWhileAnotherIsInside) {
  set_dprintf_file(file_.get());
  gSelf.debug_all_threads = 0;
  gSelf.selvane_mutex_owner = get_thread_ident() + 1;
  Outcome outcome = dispatch_line_event();
  gSelf.selvane_mutex_owner = kNoMutexOwner;
  ASSERT_TRUE(outcome.ran);
  EXPECT_EQ(outcome.result, 0);
  EXPECT_EQ(outcome.errno_after, kMarkerErrno);
  EXPECT_EQ(printed(), "ignoring thread in c_dispatch\n");
}

TEST_F(DispatchTest, InjectedExceptionInstanceIsRaisedOnceByTheNextEvent) {
  Ref exc = Ref::steal(PyObject_CallFunction(PyExc_RuntimeError, "s", "stop that"));
  ASSERT_EQ(__tracer_set_pending_exception(my_record(), exc.get()), 1);
  EXPECT_EQ(gSelf.pending_exception_count, 1);
  Outcome outcome = dispatch_line_event();
  ASSERT_TRUE(outcome.ran);
  EXPECT_EQ(outcome.result, -1);
  EXPECT_TRUE(outcome.pending.is(exc.get()));
  EXPECT_EQ(outcome.errno_after, kMarkerErrno);
  EXPECT_EQ(gSelf.pending_exception_count, 0);
  EXPECT_FALSE(my_record()->pending_exception);
  // Delivered once: the following event goes on normally.
  Outcome next = dispatch_line_event();
  EXPECT_EQ(next.result, 0);
  EXPECT_FALSE(next.pending);
}

TEST_F(DispatchTest, InjectedExceptionClassIsInstantiatedAndErrnoStillRestored) {
  PyObject* injected = coretest::item(program_.get(), "Injected");
  ASSERT_EQ(__tracer_set_pending_exception(my_record(), injected), 1);
  // Raised inside an except block, the class is made into an instance at once (to chain
  // the handled exception); its __init__ clobbers errno.
  Outcome outcome = dispatch_line_event("host_in_except");
  ASSERT_TRUE(outcome.ran);
  EXPECT_EQ(outcome.result, -1);
  ASSERT_TRUE(outcome.pending);
  EXPECT_TRUE(Py_IS_TYPE(outcome.pending.get(), reinterpret_cast<PyTypeObject*>(injected)));
  EXPECT_EQ(outcome.errno_after, kMarkerErrno);
  EXPECT_EQ(gSelf.pending_exception_count, 0);
}

TEST_F(DispatchTest, AnotherThreadsInjectedExceptionStaysWithThatThread) {
  PyThreadState* other = PyThreadState_New(PyThreadState_Get()->interp);
  ASSERT_NE(other, nullptr);
  ThreadData* other_record = insert_thread_data(&gSelf.thread_table, other);
  Ref exc = Ref::steal(PyObject_CallFunction(PyExc_RuntimeError, "s", "not yours"));
  ASSERT_EQ(__tracer_set_pending_exception(other_record, exc.get()), 1);
  Outcome outcome = dispatch_line_event();
  EXPECT_EQ(outcome.result, 0);
  EXPECT_FALSE(outcome.pending);
  EXPECT_TRUE(other_record->pending_exception.is(exc.get()));
  EXPECT_EQ(gSelf.pending_exception_count, 1);
  remove_thread_data(&gSelf.thread_table, other);
  PyThreadState_Clear(other);
  PyThreadState_Delete(other);
}

TEST_F(DispatchTest, PendingExceptionRejectsANonException) {
  ThreadData* data = my_record();
  Ref first = Ref::steal(PyObject_CallFunction(PyExc_RuntimeError, "s", "first"));
  ASSERT_EQ(__tracer_set_pending_exception(data, first.get()), 1);
  Ref number = Ref::steal(PyLong_FromLong(3));
  const Py_ssize_t number_refs = refs(number.get());
  EXPECT_EQ(__tracer_set_pending_exception(data, number.get()), 0);
  EXPECT_TRUE(PyErr_ExceptionMatches(PyExc_TypeError));
  PyErr_Clear();
  EXPECT_EQ(refs(number.get()), number_refs);
  EXPECT_TRUE(data->pending_exception.is(first.get()));  // the earlier one is kept
  EXPECT_EQ(gSelf.pending_exception_count, 1);
}

TEST_F(DispatchTest, PendingExceptionReplacedOrClearedKeepsTheCountPerThread) {
  ThreadData* data = my_record();
  Ref first = Ref::steal(PyObject_CallFunction(PyExc_RuntimeError, "s", "first"));
  Ref second = Ref::steal(PyObject_CallFunction(PyExc_KeyError, "s", "second"));
  const Py_ssize_t first_refs = refs(first.get());
  ASSERT_EQ(__tracer_set_pending_exception(data, first.get()), 1);
  ASSERT_EQ(__tracer_set_pending_exception(data, second.get()), 1);
  EXPECT_EQ(gSelf.pending_exception_count, 1);
  EXPECT_EQ(refs(first.get()), first_refs);
  EXPECT_TRUE(data->pending_exception.is(second.get()));
  ASSERT_EQ(__tracer_set_pending_exception(data, Py_None), 1);
  EXPECT_EQ(gSelf.pending_exception_count, 0);
  EXPECT_FALSE(data->pending_exception);
}

}  // namespace
