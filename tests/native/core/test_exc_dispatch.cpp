// test_exc_dispatch.cpp: exception events and frames left by an exception, called the way the
// trace dispatcher calls them, from inside a running Python function with its frame; and the
// location filters underneath, table by table.
//
// What a traced program sees of this is tested with the scripted server side; here are the
// parts it cannot see: the record kept for a frame whose exception was not reported, the
// exception argument made when a frame has no record, the catch-info list surviving reset,
// and which filter records the table holds.
#include <Python.h>
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "core/exception_dispatch.h"
#include "core/tracercore.h"
#include "exc/exceptops.h"
#include "exc/handlers.h"
#include "names/conames.h"
#include "tracer_fixture.h"

namespace {

using coretest::item;

constexpr const char* kServerSide = R"(
import builtins, io, sys
calls = []
def install_thread_hooks_cb(flag): pass
def idle_cb(): pass
def line_cb(frame, changed): pass
def return_cb(frame, value, changed): pass
def exception_cb(frame, exc, changed):
    calls.append((frame, exc))
def quit_cb(): pass
def trace_dispatch(frame, event, arg): return trace_dispatch
default_import = builtins.__import__
def import_hook(*args, **kwargs):
    return default_import(*args, **kwargs)
internal_modules = {}

class Info:
    def __init__(self, co_name, prints, parent):
        self.co_name, self.mod_name, self.containing_class = co_name, '*', '*'
        self.prints, self.parent = prints, parent

def host():
    return probe()

def bottom_plain():
    x = 1
    return probe()

def bottom_in_finally():
    try:
        return probe()
    finally:
        pass

def bottom_in_try_except():
    try:
        return probe()
    except ValueError:
        pass

def bottom_in_with():
    import contextlib
    with contextlib.nullcontext():
        return probe()

def host_in_except():
    try:
        raise KeyError('handled')
    except KeyError:
        return probe()
)";

class ExcDispatchTest : public coretest::TracerStateTest {
 protected:
  // Module load prepares the byte-code tables of the handler analysis.
  static void SetUpTestSuite() { ASSERT_EQ(init_handler_analysis(), 0); }
  void SetUp() override {
    TracerStateTest::SetUp();
    ns_ = coretest::make_namespace(kServerSide);
    module_ = Ref::steal(PyModule_New("exc_dispatch_test_module"));
    ASSERT_TRUE(module_);
    ASSERT_EQ(PyObject_SetAttrString(module_.get(), "trace_dispatch", cb("trace_dispatch")), 0);
    ASSERT_EQ(PyObject_SetAttrString(module_.get(), "__import__", cb("import_hook")), 0);
    ASSERT_EQ(__tracer_init(module_.get(), 0.0f, kExcAlwaysStop, cb("install_thread_hooks_cb"),
                            cb("idle_cb"), cb("line_cb"), cb("return_cb"), cb("exception_cb"),
                            cb("quit_cb"), Py_None, cb("default_import"), Py_None,
                            cb("internal_modules")),
              1);
    gSelf.trace_started = 1;
  }
  void TearDown() override {
    gSelf.trace_started = 0;
    __tracer_reset();
    set_catch_info_list(&gSelf.exc_data, Py_None);
    TracerStateTest::TearDown();
  }
  PyObject* cb(const char* name) { return item(ns_.get(), name); }
  Py_ssize_t callback_count() { return PyList_GET_SIZE(cb("calls")); }
  // The exception argument of call `i`.
  PyObject* callback_arg(Py_ssize_t i) {
    return PyTuple_GET_ITEM(PyList_GET_ITEM(cb("calls"), i), 1);
  }
  // The exception being handled, as an exception event's argument.
  static Ref handled_arg() {
    Ref exc = Ref::steal(PyErr_GetHandledException());
    Ref tb = Ref::steal(PyException_GetTraceback(exc.get()));
    return Ref::steal(Py_BuildValue("(OOO)", Py_TYPE(exc.get()), exc.get(), tb.get()));
  }
  void catch_info(const char* co_name, bool prints, bool parent) {
    Ref instance = Ref::steal(PyObject_CallFunction(cb("Info"), "sii", co_name, prints, parent));
    Ref list = Ref::steal(Py_BuildValue("[O]", instance.get()));
    ASSERT_EQ(set_catch_info_list(&gSelf.exc_data, list.get()), 0);
  }

  Ref ns_;
  Ref module_;
};

TEST_F(ExcDispatchTest, FilteredLocationSkipsTheCallbackButRecordsTheException) {
  bool ran = coretest::run_in_frame(ns_.get(), "host_in_except", [&](PyFrameObject* f) {
    PyObject* frame = reinterpret_cast<PyObject*>(f);
    Ref arg = handled_arg();
    // Not filtered: reported, and recorded.
    ASSERT_EQ(dispatch_exception(frame, arg.get()), 0);
    ASSERT_EQ(callback_count(), 1);
    EXPECT_EQ(callback_arg(0), arg.get());
    EXPECT_EQ(find_frame_exc_info(&gSelf.exc_data.frame_exc_info, frame), arg.get());
    forget_frame_exc_info(&gSelf.exc_data.frame_exc_info, frame);
    ASSERT_FALSE(gSelf.exc_data.frame_exc_info);

    // The place is the innermost frame of the traceback (this one) at its current line.
    const char* file = __tracer_get_full_path(&gSelf.co_pathname_table, frame);
    ASSERT_NE(file, nullptr);
    std::string path = file;
    Ref line = Ref::steal(PyLong_FromLong(PyFrame_GetLineNumber(f)));
    ASSERT_NE(__tracer_add_exc_filter(&gSelf.exc_filters, gSelf.file_ops_data, path.c_str(),
                                      line.get()),
              nullptr);
    Ref again = handled_arg();
    ASSERT_EQ(dispatch_exception(frame, again.get()), 0);
    EXPECT_EQ(callback_count(), 1) << "a filtered exception was reported";
    EXPECT_EQ(find_frame_exc_info(&gSelf.exc_data.frame_exc_info, frame), again.get());
    forget_frame_exc_info(&gSelf.exc_data.frame_exc_info, frame);
    EXPECT_EQ(PyErr_Occurred(), nullptr);
  });
  EXPECT_TRUE(ran);
}

TEST_F(ExcDispatchTest, FrameLeftWithARecordHandsThatRecordOn) {
  gSelf.exception_mode = 4;
  catch_info("host", true, true);
  bool ran = coretest::run_in_frame(ns_.get(), "host", [&](PyFrameObject* f) {
    Ref recorded = Ref::steal(Py_BuildValue("(OOO)", PyExc_OSError, Py_None, Py_None));
    EXPECT_EQ(dispatch_exception_return(reinterpret_cast<PyObject*>(f), recorded.get()), 0);
  });
  EXPECT_TRUE(ran);
  ASSERT_EQ(callback_count(), 1);
  EXPECT_TRUE(PyTuple_CheckExact(callback_arg(0)));
  EXPECT_EQ(PyTuple_GET_ITEM(callback_arg(0), 0), PyExc_OSError);
}

TEST_F(ExcDispatchTest, FrameLeftWithoutARecordReportsTheExceptionBeingHandled) {
  gSelf.exception_mode = 5;
  catch_info("host_in_except", true, true);
  Ref handled;
  bool ran = coretest::run_in_frame(ns_.get(), "host_in_except", [&](PyFrameObject* f) {
    handled = Ref::steal(PyErr_GetHandledException());
    EXPECT_EQ(dispatch_exception_return(reinterpret_cast<PyObject*>(f), nullptr), 0);
  });
  EXPECT_TRUE(ran);
  ASSERT_EQ(callback_count(), 1);
  PyObject* arg = callback_arg(0);
  ASSERT_TRUE(PyTuple_CheckExact(arg));
  ASSERT_EQ(PyTuple_GET_SIZE(arg), 3);
  EXPECT_EQ(PyTuple_GET_ITEM(arg, 0), PyExc_KeyError);
  EXPECT_EQ(PyTuple_GET_ITEM(arg, 1), handled.get());
  Ref tb = Ref::steal(PyException_GetTraceback(handled.get()));
  EXPECT_EQ(PyTuple_GET_ITEM(arg, 2), tb.get());
}

TEST_F(ExcDispatchTest, FrameLeftWithoutARecordOrHandledExceptionReportsNones) {
  gSelf.exception_mode = 4;
  catch_info("host", true, true);
  bool ran = coretest::run_in_frame(ns_.get(), "host", [&](PyFrameObject* f) {
    EXPECT_EQ(dispatch_exception_return(reinterpret_cast<PyObject*>(f), nullptr), 0);
  });
  EXPECT_TRUE(ran);
  ASSERT_EQ(callback_count(), 1);
  PyObject* arg = callback_arg(0);
  ASSERT_TRUE(PyTuple_CheckExact(arg));
  ASSERT_EQ(PyTuple_GET_SIZE(arg), 3);
  for (int i = 0; i < 3; ++i) EXPECT_EQ(PyTuple_GET_ITEM(arg, i), Py_None) << i;
}

TEST_F(ExcDispatchTest, FrameLeftIsNotReportedUnlessItsParentPrints) {
  for (int mode : {0, 1, 2, 4, 5, 7}) {
    gSelf.exception_mode = mode;
    // Printing in the frame itself is for the exception event; not parent: no report here.
    catch_info("host_in_except", true, mode == 4 || mode == 5 ? false : true);
    bool ran = coretest::run_in_frame(ns_.get(), "host_in_except", [&](PyFrameObject* f) {
      EXPECT_EQ(dispatch_exception_return(reinterpret_cast<PyObject*>(f), nullptr), 0);
    });
    EXPECT_TRUE(ran);
    EXPECT_EQ(callback_count(), 0) << "mode " << mode;
  }
}

TEST_F(ExcDispatchTest, ResetKeepsTheCatchInfoListAndDropsTheRecords) {
  gSelf.exception_mode = 4;
  catch_info("host", true, false);
  Ref index = gSelf.exc_data.catch_info;
  ASSERT_TRUE(index);
  bool ran = coretest::run_in_frame(ns_.get(), "host", [&](PyFrameObject* f) {
    Ref arg = Ref::steal(Py_BuildValue("(OOO)", PyExc_KeyError, Py_None, Py_None));
    ASSERT_EQ(set_frame_exc_info(&gSelf.exc_data.frame_exc_info, reinterpret_cast<PyObject*>(f),
                                 arg.get()),
              0);
  });
  ASSERT_TRUE(ran);
  ASSERT_TRUE(gSelf.exc_data.frame_exc_info);

  __tracer_reset();

  EXPECT_FALSE(gSelf.exc_data.frame_exc_info);
  EXPECT_TRUE(gSelf.exc_data.catch_info.is(index.get()));
  ran = coretest::run_in_frame(ns_.get(), "host", [&](PyFrameObject* f) {
    EXPECT_EQ(frame_prints_exc(&gSelf.exc_data, reinterpret_cast<PyObject*>(f)), 1);
  });
  EXPECT_TRUE(ran);
}

// The bottom frame rule: an exception in the thread's outermost frame that nothing there can
// catch stops the program in every mode, and tells the server side that it is about to end.
// "Nothing can catch" means no exception-table entry covers the instruction, leaving aside the
// entries the compiler adds around every handler body.
TEST_F(ExcDispatchTest, ExceptionInTheBottomFrameWithoutAHandlerStopsInNeverMode) {
  Ref log = coretest::make_namespace("import io\nf = io.StringIO()\n");
  const unsigned int mask = gDPrintfMask;
  gDPrintfMask = kDbgFlow | kDbgExceptions;
  struct Case {
    const char* function;
    bool bottom;
    int expected;
  };
  for (const Case& c : {Case{"bottom_plain", true, 1}, Case{"bottom_in_finally", true, 0},
                        Case{"bottom_in_try_except", true, 0}, Case{"bottom_in_with", true, 0},
                        Case{"bottom_plain", false, 0}}) {
    for (int mode : {0, 7}) {
      gSelf.exception_mode = mode;
      ThreadData* data = current_thread_data_or_insert(&gSelf.thread_table);
      ASSERT_NE(data, nullptr);
      data->leaving_bot_frame = 0;
      int answer = -1;
      set_dprintf_file(item(log.get(), "f"));
      bool ran = coretest::run_in_frame(ns_.get(), c.function, [&](PyFrameObject* f) {
        PyObject* frame = reinterpret_cast<PyObject*>(f);
        data->bot_frame = c.bottom ? Ref::borrow(frame) : Ref::none();
        Ref arg = Ref::steal(Py_BuildValue("(OOO)", PyExc_KeyError, Py_None, Py_None));
        answer = stop_at_exception_no_filters(frame, PyExc_KeyError, arg.get());
        data->bot_frame = Ref::none();
      });
      set_dprintf_file(nullptr);
      ASSERT_TRUE(ran);
      EXPECT_EQ(answer, c.expected) << c.function << " bottom=" << c.bottom << " mode " << mode;
      EXPECT_EQ(data->leaving_bot_frame, c.expected) << c.function;
    }
  }
  // The never-stop list is asked first.
  gSelf.exception_mode = 0;
  gSelf.never_stop_excepts = Ref::steal(Py_BuildValue("(O)", PyExc_LookupError));
  ThreadData* data = current_thread_data_or_insert(&gSelf.thread_table);
  data->leaving_bot_frame = 0;
  int answer = -1;
  set_dprintf_file(item(log.get(), "f"));
  coretest::run_in_frame(ns_.get(), "bottom_plain", [&](PyFrameObject* f) {
    PyObject* frame = reinterpret_cast<PyObject*>(f);
    data->bot_frame = Ref::borrow(frame);
    Ref arg = Ref::steal(Py_BuildValue("(OOO)", PyExc_KeyError, Py_None, Py_None));
    answer = stop_at_exception_no_filters(frame, PyExc_KeyError, arg.get());
    data->bot_frame = Ref::none();
  });
  set_dprintf_file(nullptr);
  gDPrintfMask = mask;
  EXPECT_EQ(answer, 0);
  EXPECT_EQ(data->leaving_bot_frame, 0);
  Ref text = Ref::steal(PyObject_CallMethod(item(log.get(), "f"), "getvalue", nullptr));
  std::string debug = PyUnicode_AsUTF8(text.get());
  EXPECT_NE(debug.find("  leaving bottom frame\n"), std::string::npos) << debug;
  EXPECT_NE(debug.find("  never stop\n"), std::string::npos) << debug;
}

// ---- the filter table --------------------------------------------------------------------------

class ExcFilterTableTest : public coretest::PythonTest {
 protected:
  void SetUp() override {
    PythonTest::SetUp();
    __tracer_init_exception_filters(&filters_);
    // Two files that exist (the file names are compared through the file system), and
    // another spelling of the first.
    Ref ns = coretest::make_namespace(
        "import os, json\n"
        "a = os.__file__\n"
        "b = json.__file__\n"
        "a2 = os.path.join(os.path.dirname(a), '.', os.path.basename(a))\n");
    a_ = PyUnicode_AsUTF8(item(ns.get(), "a"));
    b_ = PyUnicode_AsUTF8(item(ns.get(), "b"));
    a2_ = PyUnicode_AsUTF8(item(ns.get(), "a2"));
  }
  void TearDown() override {
    __tracer_clear_exception_filters(&filters_);
    CU_DeleteHashTable(&filters_.table);
    PythonTest::TearDown();
  }
  ExcFilter* add(const char* file, PyObject* loc) {
    return __tracer_add_exc_filter(&filters_, gSelf.file_ops_data, file, loc);
  }
  ExcFilter* find(const char* file, PyObject* loc) {
    return __tracer_exc_filtered(&filters_, gSelf.file_ops_data, file, loc);
  }
  // The records under the filter number of `loc`, head first.
  std::vector<ExcFilter*> chain(PyObject* loc) {
    int32_t number = _get_exc_ignore_hash_number(loc);
    std::vector<ExcFilter*> found;
    CU_HashEntry* entry = CU_FindHashEntry(&filters_.table, &number);
    for (auto* f = entry ? static_cast<ExcFilter*>(CU_GetHashValue(entry)) : nullptr;
         f != nullptr; f = f->next) {
      found.push_back(f);
    }
    return found;
  }
  bool has_entry(PyObject* loc) {
    int32_t number = _get_exc_ignore_hash_number(loc);
    return CU_FindHashEntry(&filters_.table, &number) != nullptr;
  }

  ExcFilters filters_;
  std::string a_, b_, a2_;
};

TEST_F(ExcFilterTableTest, SecondSpellingOfTheSameFileReturnsTheFirstRecord) {
  Ref ten = Ref::steal(PyLong_FromLong(10));
  ExcFilter* first = add(a_.c_str(), ten.get());
  ASSERT_NE(first, nullptr);
  ExcFilter* second = add(a2_.c_str(), ten.get());
  EXPECT_EQ(second, first);
  EXPECT_EQ(chain(ten.get()).size(), 1u);
  EXPECT_EQ(std::string(first->filename), a_);
  EXPECT_EQ(find(a2_.c_str(), ten.get()), first);
}

TEST_F(ExcFilterTableTest, RemovalNeedsTheAddedTextAndTakesTheEntryWithTheLastRecord) {
  Ref ten = Ref::steal(PyLong_FromLong(10));
  ASSERT_NE(add(a_.c_str(), ten.get()), nullptr);
  __tracer_del_exc_filter(&filters_, a2_.c_str(), ten.get());
  EXPECT_EQ(chain(ten.get()).size(), 1u);
  __tracer_del_exc_filter(&filters_, a_.c_str(), ten.get());
  EXPECT_TRUE(chain(ten.get()).empty());
  EXPECT_FALSE(has_entry(ten.get())) << "the emptied entry stays in the table";
  __tracer_del_exc_filter(&filters_, a_.c_str(), ten.get());  // nothing left: no-op
}

TEST_F(ExcFilterTableTest, FiltersWithOneNumberShareAnEntry) {
  Ref ten = Ref::steal(PyLong_FromLong(10));
  Ref pair = Ref::steal(Py_BuildValue("(ii)", 3, 7));
  ExcFilter* a = add(a_.c_str(), ten.get());
  ExcFilter* b = add(b_.c_str(), pair.get());
  ASSERT_NE(a, nullptr);
  ASSERT_NE(b, nullptr);
  ASSERT_NE(a, b);
  EXPECT_EQ(chain(ten.get()), (std::vector<ExcFilter*>{b, a}));  // newest first
  EXPECT_EQ(find(a_.c_str(), pair.get()), a);
  EXPECT_EQ(find(b_.c_str(), ten.get()), b);
  // Removing A (by either location of its number) leaves B in force, in the same entry.
  __tracer_del_exc_filter(&filters_, a_.c_str(), pair.get());
  EXPECT_EQ(chain(ten.get()), (std::vector<ExcFilter*>{b}));
  EXPECT_EQ(find(a_.c_str(), ten.get()), nullptr);
  EXPECT_EQ(find(b_.c_str(), ten.get()), b);
  __tracer_del_exc_filter(&filters_, b_.c_str(), ten.get());
  EXPECT_FALSE(has_entry(ten.get()));
}

TEST_F(ExcFilterTableTest, ParserLineFilterNeedsTheNameEndingAndLine134) {
  EXPECT_EQ(__tracer_exc_filtered_hack("/usr/lib/python3.11/sre_parse.py", 134), 1);
  EXPECT_EQ(__tracer_exc_filtered_hack("sre_parse.py", 134), 1);
  EXPECT_EQ(__tracer_exc_filtered_hack("/x/my_sre_parse.py", 134), 1);
  EXPECT_EQ(__tracer_exc_filtered_hack("/usr/lib/python3.11/sre_parse.py", 133), 0);
  EXPECT_EQ(__tracer_exc_filtered_hack("/usr/lib/python3.11/sre_parse.py", 135), 0);
  EXPECT_EQ(__tracer_exc_filtered_hack("/usr/lib/python3.11/sre_parse.pyc", 134), 0);
  EXPECT_EQ(__tracer_exc_filtered_hack("/usr/lib/python3.11/re/_parser.py", 134), 0);
  EXPECT_EQ(__tracer_exc_filtered_hack("re_parse.py", 134), 0);
  EXPECT_EQ(__tracer_exc_filtered_hack("a.py", 134), 0);
  EXPECT_EQ(__tracer_exc_filtered_hack("", 134), 0);
  EXPECT_EQ(__tracer_exc_filtered_hack(nullptr, 134), 0);
}

}  // namespace
