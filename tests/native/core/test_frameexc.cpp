// test_frameexc.cpp: the exception argument recorded per frame.
//
// A record lives from the store until the dispatcher forgets it: nothing collects records
// behind the dispatcher's back, so a store or a forget costs the same however many records
// there are, and a forgotten record gives back every reference it held.
#include <Python.h>
#include <gtest/gtest.h>

#include "core_test_support.h"
#include "exc/exceptops.h"

namespace {

using coretest::item;
using coretest::refs;

constexpr const char* kProgram = R"(
import sys, types

def finished_frame():
    return sys._getframe()

def frames(n):
    return [finished_frame() for _ in range(n)]

def tb_chain(frame, n):
    tb = None
    for _ in range(n):
        tb = types.TracebackType(tb, frame, 0, 1)
    return tb

def c(n):
    raise KeyError(n)

def still_running():
    try:
        raise ValueError('here')
    except ValueError:
        return probe()
)";

class FrameExcTest : public coretest::PythonTest {
 protected:
  void SetUp() override {
    PythonTest::SetUp();
    ns_ = coretest::make_namespace(kProgram);
  }
  void TearDown() override {
    records_.reset();
    ns_.reset();
    PythonTest::TearDown();
  }
  Ref call(const char* name, const char* format = nullptr, PyObject* arg1 = nullptr, long n = 0) {
    PyObject* fn = item(ns_.get(), name);
    Ref result;
    if (format == nullptr) {
      result = Ref::steal(PyObject_CallNoArgs(fn));
    } else if (arg1 != nullptr) {
      result = Ref::steal(PyObject_CallFunction(fn, format, arg1, n));
    } else {
      result = Ref::steal(PyObject_CallFunction(fn, format, n));
    }
    if (!result) {
      PyErr_Print();
      ADD_FAILURE() << name << "() raised";
    }
    return result;
  }
  // A frame object whose function has returned, held only by the result.
  Ref finished_frame() { return call("finished_frame"); }
  Py_ssize_t size() const { return records_ ? PyDict_GET_SIZE(records_.get()) : -1; }
  void store(PyObject* frame, PyObject* value) {
    if (!records_) records_ = Ref::steal(PyDict_New());
    ASSERT_EQ(PyDict_SetItem(records_.get(), frame, value), 0);
  }

  Ref ns_;
  Ref records_;  // the record dictionary under test, as ExcData holds it
};

TEST_F(FrameExcTest, StoreCreatesTheDictionaryFindAndForgetEmptyIt) {
  Ref frame = finished_frame();
  Ref arg = Ref::steal(Py_BuildValue("(OOO)", PyExc_KeyError, Py_None, Py_None));
  EXPECT_EQ(find_frame_exc_info(&records_, frame.get()), nullptr);
  EXPECT_EQ(forget_frame_exc_info(&records_, frame.get()), 0);
  EXPECT_FALSE(records_);
  ASSERT_EQ(set_frame_exc_info(&records_, frame.get(), arg.get()), 0);
  ASSERT_TRUE(records_);
  EXPECT_EQ(find_frame_exc_info(&records_, frame.get()), arg.get());
  // A second event in the frame replaces the first.
  Ref later = Ref::steal(Py_BuildValue("(OOO)", PyExc_ValueError, Py_None, Py_None));
  ASSERT_EQ(set_frame_exc_info(&records_, frame.get(), later.get()), 0);
  EXPECT_EQ(size(), 1);
  EXPECT_EQ(find_frame_exc_info(&records_, frame.get()), later.get());
  Ref other = finished_frame();
  EXPECT_EQ(find_frame_exc_info(&records_, other.get()), nullptr);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
  // Removing the only entry releases the dictionary.
  EXPECT_EQ(forget_frame_exc_info(&records_, frame.get()), 0);
  EXPECT_FALSE(records_);
}

TEST_F(FrameExcTest, RecordOfARunningFrameStaysUntilItIsForgotten) {
  // The record an exception event makes, while the frame still runs: the frame is alive
  // (the interpreter runs it), so no collection removes it, though its traceback refers to
  // it too.
  bool ran = coretest::run_in_frame(ns_.get(), "still_running", [&](PyFrameObject* f) {
    PyObject* frame = reinterpret_cast<PyObject*>(f);
    Ref handled = Ref::steal(PyErr_GetHandledException());
    ASSERT_TRUE(handled);
    Ref tb = Ref::steal(PyException_GetTraceback(handled.get()));
    ASSERT_TRUE(tb);
    Ref arg = Ref::steal(Py_BuildValue("(OOO)", Py_TYPE(handled.get()), handled.get(), tb.get()));
    ASSERT_EQ(set_frame_exc_info(&records_, frame, arg.get()), 0);
    EXPECT_EQ(find_frame_exc_info(&records_, frame), arg.get());
    forget_frame_exc_info(&records_, frame);
  });
  EXPECT_TRUE(ran);
  EXPECT_FALSE(records_);
}

TEST_F(FrameExcTest, RecordsStayUntilForgottenWhateverElseRefersToTheirFrames) {
  // Frames that nothing but their records refers to any more: still there, since only the
  // dispatcher knows when a frame is done with its exception.
  Ref frames = call("frames", "l", nullptr, 150);
  ASSERT_TRUE(frames);
  for (Py_ssize_t i = 0; i < 150; ++i) store(PyList_GET_ITEM(frames.get(), i), Py_None);
  PyObject* first = PyList_GET_ITEM(frames.get(), 0);
  Ref kept = Ref::borrow(first);
  frames.reset();
  Ref frame = finished_frame();
  ASSERT_EQ(set_frame_exc_info(&records_, frame.get(), Py_None), 0);
  EXPECT_EQ(size(), 151);
  EXPECT_EQ(forget_frame_exc_info(&records_, frame.get()), 0);
  EXPECT_EQ(size(), 150);
  EXPECT_EQ(forget_frame_exc_info(&records_, kept.get()), 0);
  EXPECT_EQ(size(), 149);
}

TEST_F(FrameExcTest, ForgottenRecordGivesBackItsArgumentAndFrame) {
  Ref frame = finished_frame();
  Ref tb = call("tb_chain", "Ol", frame.get(), 3);
  Ref arg = Ref::steal(Py_BuildValue("(OOO)", PyExc_KeyError, Py_None, tb.get()));
  const Py_ssize_t frame_refs = refs(frame.get());
  const Py_ssize_t arg_refs = refs(arg.get());
  ASSERT_EQ(set_frame_exc_info(&records_, frame.get(), arg.get()), 0);
  EXPECT_EQ(refs(frame.get()), frame_refs + 1);
  EXPECT_EQ(refs(arg.get()), arg_refs + 1);
  // Another event in the frame replaces the argument: the first one is given back.
  ASSERT_EQ(set_frame_exc_info(&records_, frame.get(), Py_None), 0);
  EXPECT_EQ(refs(arg.get()), arg_refs);
  EXPECT_EQ(forget_frame_exc_info(&records_, frame.get()), 0);
  EXPECT_EQ(refs(frame.get()), frame_refs);
  EXPECT_FALSE(records_);
}

TEST_F(FrameExcTest, ForgetKeepsThePendingException) {
  Ref frame = finished_frame();
  Ref other = finished_frame();
  Ref arg = Ref::steal(Py_BuildValue("(OOO)", PyExc_KeyError, Py_None, Py_None));
  store(frame.get(), arg.get());
  store(other.get(), arg.get());

  PyObject* fn = item(ns_.get(), "c");
  Ref result = Ref::steal(PyObject_CallFunction(fn, "i", 7));
  ASSERT_FALSE(result);
  PyObject *type = nullptr, *value = nullptr, *tb = nullptr;
  PyErr_Fetch(&type, &value, &tb);
  ASSERT_NE(type, nullptr);
  PyErr_Restore(Py_NewRef(type), Py_XNewRef(value), Py_XNewRef(tb));

  EXPECT_EQ(forget_frame_exc_info(&records_, frame.get()), 0);
  EXPECT_EQ(size(), 1) << "the other frame's record stays";
  EXPECT_EQ(forget_frame_exc_info(&records_, other.get()), 0);
  EXPECT_FALSE(records_) << "both records gone: the dictionary is released";

  PyObject *type2 = nullptr, *value2 = nullptr, *tb2 = nullptr;
  PyErr_Fetch(&type2, &value2, &tb2);
  EXPECT_EQ(type2, type);
  EXPECT_EQ(value2, value);
  EXPECT_EQ(tb2, tb);
  for (PyObject* o : {type, value, tb, type2, value2, tb2}) Py_XDECREF(o);
}

TEST_F(FrameExcTest, ForgetOfAFrameWithoutARecordChangesNothing) {
  Ref keep = finished_frame();
  store(keep.get(), Py_None);
  Ref stranger = finished_frame();
  EXPECT_EQ(forget_frame_exc_info(&records_, stranger.get()), 0);
  EXPECT_EQ(size(), 1);
  EXPECT_NE(find_frame_exc_info(&records_, keep.get()), nullptr);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

}  // namespace
