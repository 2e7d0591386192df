// test_frameexc.cpp: the exception argument recorded per frame, and its collector.
//
// The collector keeps a record while something besides the record itself (the dictionary's
// key and the record's own traceback) refers to its frame. The cases build records from real
// frames, with tracebacks made by the interpreter or by hand, and count what one collection
// removes.
#include <Python.h>
#include <gtest/gtest.h>

#include <map>
#include <string>
#include <vector>

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

def child_of(*ignored):
    # A finished frame whose f_back is a finished frame of its own.
    def parent():
        return finished_frame()
    return parent()

class TupleSub(tuple):
    pass

events = []
def recorder(frame, event, arg):
    if event == 'exception':
        events.append((frame, arg))
    return recorder

def c(n):
    raise KeyError(n)

def b(n):
    c(n)

def a(n):
    try:
        b(n)
    except KeyError:
        pass

def record_exception_events(n):
    sys.settrace(recorder)
    try:
        for i in range(n):
            a(i)
    finally:
        sys.settrace(None)

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
  Ref call(const char* name, const char* format = nullptr, PyObject* arg1 = nullptr,
           long n = 0) {
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
  Py_ssize_t size() const {
    return records_ ? PyDict_GET_SIZE(records_.get()) : -1;
  }
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
    Ref arg = Ref::steal(
        Py_BuildValue("(OOO)", Py_TYPE(handled.get()), handled.get(), tb.get()));
    ASSERT_EQ(set_frame_exc_info(&records_, frame, arg.get()), 0);
    for (int i = 0; i < 3; ++i) EXPECT_EQ(gc_exc_info_for_frame(&records_), 0);
    EXPECT_EQ(find_frame_exc_info(&records_, frame), arg.get());
    forget_frame_exc_info(&records_, frame);
  });
  EXPECT_TRUE(ran);
  EXPECT_FALSE(records_);
}

TEST_F(FrameExcTest, RecordHeldOnlyThroughItsOwnTracebackIsCollected) {
  Ref frame = finished_frame();
  Ref tb = call("tb_chain", "Ol", frame.get(), 1);
  Ref arg = Ref::steal(Py_BuildValue("(OOO)", PyExc_KeyError, Py_None, tb.get()));
  store(frame.get(), arg.get());
  tb.reset();
  arg.reset();
  // Held by us as well: alive.
  ASSERT_EQ(gc_exc_info_for_frame(&records_), 0);
  EXPECT_EQ(size(), 1);
  // Now only the key and the record's traceback refer to it: dead.
  PyObject* raw = frame.get();
  EXPECT_EQ(refs(raw), 3);
  frame.reset();
  ASSERT_EQ(gc_exc_info_for_frame(&records_), 0);
  EXPECT_EQ(size(), 0);
}

TEST_F(FrameExcTest, RecordThatIsNotAnExceptionTripleLivesWhileTheFrameIsReferenced) {
  // Values the collector does not read: a traceback in them is not subtracted, so such an
  // entry stays as long as the frame's count is above 1, even when that second reference is
  // the value's own traceback.
  struct Case {
    const char* label;
    Ref frame;
    Ref value;
  };
  std::vector<Case> cases;
  {
    Ref frame = finished_frame();
    Ref tb = call("tb_chain", "Ol", frame.get(), 1);
    Ref triple = Ref::steal(Py_BuildValue("(OOO)", PyExc_KeyError, Py_None, tb.get()));
    Ref sub = Ref::steal(PyObject_CallOneArg(item(ns_.get(), "TupleSub"), triple.get()));
    cases.push_back({"tuple subclass", frame, sub});
  }
  {
    Ref frame = finished_frame();
    Ref tb = call("tb_chain", "Ol", frame.get(), 1);
    cases.push_back({"list", frame,
                     Ref::steal(Py_BuildValue("[OOO]", PyExc_KeyError, Py_None, tb.get()))});
  }
  {
    Ref frame = finished_frame();
    Ref tb = call("tb_chain", "Ol", frame.get(), 1);
    cases.push_back({"two items", frame, Ref::steal(Py_BuildValue("(OO)", PyExc_KeyError,
                                                                  tb.get()))});
  }
  {
    Ref frame = finished_frame();
    Ref tb = call("tb_chain", "Ol", frame.get(), 1);
    // The traceback in the wrong place: item 1, with a plain object as item 2.
    cases.push_back({"no traceback third", frame,
                     Ref::steal(Py_BuildValue("(OOO)", PyExc_KeyError, tb.get(), Py_None))});
  }
  {
    Ref frame = finished_frame();
    cases.push_back({"string", frame, Ref::steal(PyUnicode_FromString("not a triple"))});
  }
  for (auto& c : cases) store(c.frame.get(), c.value.get());
  const Py_ssize_t n = static_cast<Py_ssize_t>(cases.size());
  // The frame held by the case as well: every entry stays.
  ASSERT_EQ(gc_exc_info_for_frame(&records_), 0);
  EXPECT_EQ(size(), n);
  // Only the record refers to the frame (its key, and for some its traceback): the entries
  // whose value holds a traceback to the frame still have a count of 2 and stay; the string's
  // frame is at 1 and goes.
  for (auto& c : cases) {
    c.frame.reset();
    c.value.reset();
  }
  ASSERT_EQ(gc_exc_info_for_frame(&records_), 0);
  EXPECT_EQ(size(), n - 1);
  Py_ssize_t pos = 0;
  PyObject *key, *value;
  while (PyDict_Next(records_.get(), &pos, &key, &value)) {
    EXPECT_EQ(refs(key), 2) << Py_TYPE(value)->tp_name;
    EXPECT_FALSE(PyUnicode_Check(value));
  }
  // A collection is not a one-off decision: they stay on later runs too.
  ASSERT_EQ(gc_exc_info_for_frame(&records_), 0);
  EXPECT_EQ(size(), n - 1);
}

TEST_F(FrameExcTest, TracebackReferencesAreCountedPerEntryUpTo1000Entries) {
  Ref frame = finished_frame();
  Ref tb1000 = call("tb_chain", "Ol", frame.get(), 1000);
  Ref tb1001 = call("tb_chain", "Ol", frame.get(), 1001);
  EXPECT_EQ(ref_count_in_tb(tb1000.get(), frame.get()), 1000);
  EXPECT_EQ(ref_count_in_tb(tb1001.get(), frame.get()), 0);
  Ref other = finished_frame();
  EXPECT_EQ(ref_count_in_tb(tb1000.get(), other.get()), 0);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

TEST_F(FrameExcTest, FrameInTheBackChainOfSeveralEntriesIsCountedForEach) {
  // An estimate, on purpose: the child's f_back is one reference to the parent, but every
  // traceback entry whose back chain passes the parent counts it.
  Ref child = call("child_of", "Ol", Py_None, 0);
  ASSERT_TRUE(child);
  Ref parent = Ref::steal(PyObject_GetAttrString(child.get(), "f_back"));
  ASSERT_TRUE(parent && !parent.is_none());
  Ref tb = call("tb_chain", "Ol", child.get(), 3);  // three entries at the child
  EXPECT_EQ(ref_count_in_tb(tb.get(), parent.get()), 3);
  EXPECT_EQ(ref_count_in_tb(tb.get(), child.get()), 3);
  Ref tb_parent = Ref::steal(PyObject_CallFunction(reinterpret_cast<PyObject*>(Py_TYPE(tb.get())),
                                                   "OOii", tb.get(), parent.get(), 0, 1));
  ASSERT_TRUE(tb_parent);
  EXPECT_EQ(ref_count_in_tb(tb_parent.get(), parent.get()), 4);
  EXPECT_EQ(ref_count_in_tb(tb_parent.get(), child.get()), 3);
}

TEST_F(FrameExcTest, TracebackLongerThan1000EntriesKeepsTheEntryAlive) {
  for (int length : {1000, 1001}) {
    Ref frame = finished_frame();
    Ref tb = call("tb_chain", "Ol", frame.get(), length);
    Ref arg = Ref::steal(Py_BuildValue("(OOO)", PyExc_KeyError, Py_None, tb.get()));
    records_.reset();
    store(frame.get(), arg.get());
    tb.reset();
    arg.reset();
    PyObject* raw = frame.get();
    frame.reset();
    // Referred to by the key and by every entry of its record's traceback, nothing else.
    EXPECT_EQ(refs(raw), 1 + length);
    ASSERT_EQ(gc_exc_info_for_frame(&records_), 0);
    if (length == 1000) {
      EXPECT_EQ(size(), 0) << "1000 entries are walked and subtracted";
    } else {
      EXPECT_EQ(size(), 1) << "past 1000 entries nothing is subtracted";
      ASSERT_EQ(gc_exc_info_for_frame(&records_), 0);
      EXPECT_EQ(size(), 1);
    }
  }
}

TEST_F(FrameExcTest, OneCollectionRemovesAtMostOneHundredDeadEntries) {
  Ref dead = call("frames", "l", nullptr, 150);
  Ref live = call("frames", "l", nullptr, 5);
  ASSERT_TRUE(dead && live);
  // Live entries first and among the dead ones: the walk passes over them.
  for (Py_ssize_t i = 0; i < 150; ++i) {
    if (i % 40 == 0) store(PyList_GET_ITEM(live.get(), i / 40), Py_None);
    store(PyList_GET_ITEM(dead.get(), i), Py_None);
  }
  store(PyList_GET_ITEM(live.get(), 4), Py_None);
  dead.reset();
  ASSERT_EQ(size(), 155);
  ASSERT_EQ(gc_exc_info_for_frame(&records_), 0);
  EXPECT_EQ(size(), 55);
  ASSERT_EQ(gc_exc_info_for_frame(&records_), 0);
  EXPECT_EQ(size(), 5);
  ASSERT_EQ(gc_exc_info_for_frame(&records_), 0);
  EXPECT_EQ(size(), 5);
  live.reset();
  ASSERT_EQ(gc_exc_info_for_frame(&records_), 0);
  EXPECT_EQ(size(), 0);
}

TEST_F(FrameExcTest, RecordsOfRealExceptionEventsGoAwayOverSuccessiveRuns) {
  // Exceptions raised two calls down and caught: the events of the three frames, with the
  // arguments the interpreter gave, recorded as the tracer records them. The frames are
  // finished, but each child's f_back keeps its parent alive, and the tracebacks refer to
  // all of them. Once nothing but the records refers to them, collections empty the
  // dictionary, at most 100 entries a run.
  Ref done = call("record_exception_events", "l", nullptr, 60);
  ASSERT_TRUE(done);
  PyObject* events = item(ns_.get(), "events");
  ASSERT_EQ(PyList_GET_SIZE(events), 180);
  for (Py_ssize_t i = 0; i < PyList_GET_SIZE(events); ++i) {
    PyObject* event = PyList_GET_ITEM(events, i);
    ASSERT_EQ(set_frame_exc_info(&records_, PyTuple_GET_ITEM(event, 0),
                                 PyTuple_GET_ITEM(event, 1)),
              0);
  }
  // The list of events still refers to every frame: the records of the raising frames and
  // of the frames the exception passed through stay. The catching frame is another matter:
  // every traceback entry below it counts it once more through the back chains (three for
  // the two references that the traceback and the child's f_back really hold), so its
  // record is judged dead while the list still refers to it. The estimate is deliberate.
  ASSERT_EQ(gc_exc_info_for_frame(&records_), 0);
  std::map<std::string, int> kept;
  Py_ssize_t pos = 0;
  PyObject *key, *value;
  while (PyDict_Next(records_.get(), &pos, &key, &value)) {
    Ref code = Ref::steal(reinterpret_cast<PyObject*>(
        PyFrame_GetCode(reinterpret_cast<PyFrameObject*>(key))));
    ++kept[PyUnicode_AsUTF8(reinterpret_cast<PyCodeObject*>(code.get())->co_name)];
  }
  EXPECT_EQ(kept["c"], 60);
  EXPECT_EQ(kept["b"], 60);
  EXPECT_EQ(kept["a"], 0);
  ASSERT_EQ(PyList_SetSlice(events, 0, PyList_GET_SIZE(events), nullptr), 0);
  const Py_ssize_t size_before = size();
  ASSERT_GT(size_before, 100);
  std::vector<Py_ssize_t> sizes;
  for (int run = 0; run < 6 && size() > 0; ++run) {
    ASSERT_EQ(gc_exc_info_for_frame(&records_), 0);
    sizes.push_back(size());
  }
  ASSERT_FALSE(sizes.empty());
  EXPECT_EQ(sizes.front(), size_before - 100) << "the first run removes exactly 100";
  EXPECT_EQ(size(), 0) << "records left after " << sizes.size() << " runs";
}

TEST_F(FrameExcTest, ForgetKeepsThePendingException) {
  Ref frame = finished_frame();
  Ref other = finished_frame();
  Ref arg = Ref::steal(Py_BuildValue("(OOO)", PyExc_KeyError, Py_None, Py_None));
  store(frame.get(), arg.get());
  store(other.get(), arg.get());
  other.reset();  // a dead record that the forget's collection removes

  PyObject* fn = item(ns_.get(), "c");
  Ref result = Ref::steal(PyObject_CallFunction(fn, "i", 7));
  ASSERT_FALSE(result);
  PyObject *type = nullptr, *value = nullptr, *tb = nullptr;
  PyErr_Fetch(&type, &value, &tb);
  ASSERT_NE(type, nullptr);
  PyErr_Restore(Py_NewRef(type), Py_XNewRef(value), Py_XNewRef(tb));

  EXPECT_EQ(forget_frame_exc_info(&records_, frame.get()), 0);
  EXPECT_FALSE(records_) << "both records gone: the dictionary is released";

  PyObject *type2 = nullptr, *value2 = nullptr, *tb2 = nullptr;
  PyErr_Fetch(&type2, &value2, &tb2);
  EXPECT_EQ(type2, type);
  EXPECT_EQ(value2, value);
  EXPECT_EQ(tb2, tb);
  for (PyObject* o : {type, value, tb, type2, value2, tb2}) Py_XDECREF(o);
}

TEST_F(FrameExcTest, ForgetOfAFrameWithoutARecordStillCollects) {
  Ref keep = finished_frame();
  Ref gone = finished_frame();
  store(keep.get(), Py_None);
  store(gone.get(), Py_None);
  gone.reset();
  Ref stranger = finished_frame();
  EXPECT_EQ(forget_frame_exc_info(&records_, stranger.get()), 0);
  EXPECT_EQ(size(), 1);
  EXPECT_NE(find_frame_exc_info(&records_, keep.get()), nullptr);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

TEST_F(FrameExcTest, StoreCollectsFirst) {
  Ref gone = finished_frame();
  store(gone.get(), Py_None);
  gone.reset();
  Ref frame = finished_frame();
  ASSERT_EQ(set_frame_exc_info(&records_, frame.get(), Py_None), 0);
  EXPECT_EQ(size(), 1);
  EXPECT_NE(find_frame_exc_info(&records_, frame.get()), nullptr);
}

}  // namespace
