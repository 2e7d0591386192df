// test_dbgcommon.cpp: the helpers through which the core reaches the interpreter: fetching
// a callable by module and name (and the messages of its failures), calls with one to three
// arguments, symbol lookup, string conversion and frame walking.
#include "support/dbgcommon.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <string>

#include "core_test_support.h"
#include "support/dprintf.h"

namespace {

using coretest::DebugCapture;
using coretest::refs;

// Lookup failures are class 1, which is off by default: the tests turn it on.
constexpr unsigned int kWithLookup = kDbgLookup | kDbgFlow | kDbgExceptions;

class GetModuleFctTest : public coretest::PythonTest {};

TEST_F(GetModuleFctTest, CallableAttributeIsReturnedAsANewReference) {
  Ref math = Ref::steal(PyImport_ImportModule("math"));
  Ref sqrt = Ref::steal(PyObject_GetAttrString(math.get(), "sqrt"));
  const Py_ssize_t before = refs(sqrt.get());
  DebugCapture capture(kWithLookup);
  PyObject* found = get_module_fct("math", "sqrt");
  EXPECT_EQ(found, sqrt.get());
  EXPECT_EQ(refs(sqrt.get()), before + 1);
  Py_XDECREF(found);
  EXPECT_EQ(capture.text(), "");
}

TEST_F(GetModuleFctTest, NonCallableAttributeGivesNullNoErrorAndAMessage) {
  Ref math = Ref::steal(PyImport_ImportModule("math"));
  Ref pi = Ref::steal(PyObject_GetAttrString(math.get(), "pi"));
  const Py_ssize_t before = refs(pi.get());
  DebugCapture capture(kWithLookup);
  EXPECT_EQ(get_module_fct("math", "pi"), nullptr);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
  EXPECT_EQ(refs(pi.get()), before);  // the attribute fetched for the test is released
  EXPECT_EQ(capture.text(), "math.pi is not callable\n");
}

TEST_F(GetModuleFctTest, MissingModuleLeavesTheImportErrorPending) {
  DebugCapture capture(kWithLookup);
  EXPECT_EQ(get_module_fct("no_such_module_for_core_tests", "f"), nullptr);
  EXPECT_TRUE(PyErr_ExceptionMatches(PyExc_ModuleNotFoundError));
  PyErr_Clear();
  EXPECT_EQ(capture.text(), "module no_such_module_for_core_tests not found\n");
}

TEST_F(GetModuleFctTest, MissingAttributeLeavesTheAttributeErrorPending) {
  DebugCapture capture(kWithLookup);
  EXPECT_EQ(get_module_fct("math", "no_such_function"), nullptr);
  EXPECT_TRUE(PyErr_ExceptionMatches(PyExc_AttributeError));
  PyErr_Clear();
  EXPECT_EQ(capture.text(), "math.no_such_function function not found\n");
}

TEST_F(GetModuleFctTest, NonAsciiNamesArePrintedAsPlaceholders) {
  DebugCapture capture(kWithLookup);
  EXPECT_EQ(get_module_fct("modul\xc3\xa9", "f"), nullptr);
  PyErr_Clear();
  EXPECT_EQ(get_module_fct("math", "f\xc3\xbcnf"), nullptr);
  PyErr_Clear();
  EXPECT_EQ(capture.text(),
            "module (non-ascii string) not found\n"
            "math.(non-ascii string) function not found\n");
}

TEST_F(GetModuleFctTest, FailuresAreSilentUnderTheDefaultMask) {
  DebugCapture capture(kDbgFlow | kDbgExceptions);
  EXPECT_EQ(get_module_fct("math", "pi"), nullptr);
  EXPECT_EQ(capture.text(), "");
}

// ---- Calls ------------------------------------------------------------------------------

class CallHelpersTest : public coretest::PythonTest {
 protected:
  void SetUp() override {
    PythonTest::SetUp();
    globals_ = coretest::make_namespace(
        "def collect(*args):\n"
        "    return args\n"
        "def refuse(*args):\n"
        "    raise LookupError('refused')\n");
    collect_ = coretest::item(globals_.get(), "collect");
    refuse_ = coretest::item(globals_.get(), "refuse");
    for (int i = 0; i < 3; ++i) {
      // Objects nobody else holds, so that any change of their counts is ours.
      args_[i] = Ref::steal(PyList_New(0));
    }
  }
  // The result must be exactly (args_[0], ..., args_[n - 1]), in order, by identity.
  void expect_args(PyObject* result, int n) {
    ASSERT_NE(result, nullptr);
    ASSERT_TRUE(PyTuple_Check(result));
    ASSERT_EQ(PyTuple_GET_SIZE(result), n);
    for (int i = 0; i < n; ++i) EXPECT_EQ(PyTuple_GET_ITEM(result, i), args_[i].get()) << i;
  }
  void expect_counts_unchanged(const Py_ssize_t (&before)[3]) {
    for (int i = 0; i < 3; ++i) EXPECT_EQ(refs(args_[i].get()), before[i]) << i;
  }
  void counts(Py_ssize_t (&out)[3]) {
    for (int i = 0; i < 3; ++i) out[i] = refs(args_[i].get());
  }

  Ref globals_;
  PyObject* collect_ = nullptr;
  PyObject* refuse_ = nullptr;
  Ref args_[3];
};

TEST_F(CallHelpersTest, OneArgument) {
  Py_ssize_t before[3];
  counts(before);
  Ref result = Ref::steal(do_one_arg_call(collect_, args_[0].get()));
  expect_args(result.get(), 1);
  result.reset();
  expect_counts_unchanged(before);
}

TEST_F(CallHelpersTest, TwoArgumentsInOrder) {
  Py_ssize_t before[3];
  counts(before);
  Ref result = Ref::steal(do_two_arg_call(collect_, args_[0].get(), args_[1].get()));
  expect_args(result.get(), 2);
  result.reset();
  expect_counts_unchanged(before);
}

TEST_F(CallHelpersTest, ThreeArgumentsInOrder) {
  Py_ssize_t before[3];
  counts(before);
  Ref result =
      Ref::steal(do_three_arg_call(collect_, args_[0].get(), args_[1].get(), args_[2].get()));
  expect_args(result.get(), 3);
  result.reset();
  expect_counts_unchanged(before);
}

TEST_F(CallHelpersTest, RaisingCallableGivesNullWithItsErrorAndKeepsCounts) {
  Py_ssize_t before[3];
  counts(before);
  EXPECT_EQ(do_one_arg_call(refuse_, args_[0].get()), nullptr);
  EXPECT_TRUE(PyErr_ExceptionMatches(PyExc_LookupError));
  PyErr_Clear();
  EXPECT_EQ(do_two_arg_call(refuse_, args_[0].get(), args_[1].get()), nullptr);
  EXPECT_TRUE(PyErr_ExceptionMatches(PyExc_LookupError));
  PyErr_Clear();
  EXPECT_EQ(do_three_arg_call(refuse_, args_[0].get(), args_[1].get(), args_[2].get()), nullptr);
  EXPECT_TRUE(PyErr_ExceptionMatches(PyExc_LookupError));
  PyErr_Clear();
  expect_counts_unchanged(before);
}

// ---- Symbols and strings ----------------------------------------------------------------

class LookupAndStringsTest : public coretest::PythonTest {};

TEST_F(LookupAndStringsTest, LookupFindsInterpreterFunctionsOnly) {
  EXPECT_EQ(lookup_python_function("PyUnicode_FromString"),
            reinterpret_cast<void*>(&PyUnicode_FromString));
  EXPECT_EQ(lookup_python_function("PyThread_get_thread_ident"),
            reinterpret_cast<void*>(&PyThread_get_thread_ident));
  EXPECT_EQ(lookup_python_function("PyUnicode_NoSuchFunctionForCoreTests"), nullptr);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

TEST_F(LookupAndStringsTest, OverlongSymbolNameIsNotFound) {
  std::string name = "PyUnicode_FromString";
  name.append(600, 'x');
  EXPECT_EQ(lookup_python_function(name.c_str()), nullptr);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

TEST_F(LookupAndStringsTest, StringConversionOfAStrBorrowsItsText) {
  Ref text = Ref::steal(PyUnicode_FromString("caf\xc3\xa9 au lait"));
  const char* c_text = _pystring_to_c_string(text.get());
  ASSERT_NE(c_text, nullptr);
  EXPECT_STREQ(c_text, "caf\xc3\xa9 au lait");
  EXPECT_EQ(c_text, PyUnicode_AsUTF8(text.get()));
}

TEST_F(LookupAndStringsTest, StringConversionOfANonStrIsNullWithNoError) {
  DebugCapture capture(kDbgPathnames);
  Ref number = Ref::steal(PyLong_FromLong(12));
  EXPECT_EQ(_pystring_to_c_string(number.get()), nullptr);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
  EXPECT_EQ(_pystring_to_c_string(nullptr), nullptr);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
  EXPECT_EQ(capture.text(),
            "FAILURE: Could not convert unicode to UTF-8: (non-PyString PyObject*)"
            "FAILURE: Could not convert unicode to UTF-8: (NULL PyObject*)");
}

TEST_F(LookupAndStringsTest, StringConversionOfAnUnencodableStrIsNullWithNoError) {
  // A lone surrogate has no UTF-8 form: the interpreter's conversion raises, we must not.
  Ref text = Ref::steal(PyUnicode_DecodeUTF8("a\xed\xb2\x80", 4, "surrogateescape"));
  ASSERT_TRUE(text);
  EXPECT_EQ(_pystring_to_c_string(text.get()), nullptr);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
  EXPECT_EQ(_pystring_to_c_string_copy(text.get()), nullptr);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

TEST_F(LookupAndStringsTest, CopyIsAnIndependentMallocedText) {
  Ref text = Ref::steal(PyUnicode_FromString("copied"));
  char* copy = _pystring_to_c_string_copy(text.get());
  ASSERT_NE(copy, nullptr);
  EXPECT_STREQ(copy, "copied");
  EXPECT_NE(copy, PyUnicode_AsUTF8(text.get()));
  copy[0] = 'C';  // ours to change: the object's text stays as it was
  EXPECT_STREQ(PyUnicode_AsUTF8(text.get()), "copied");
  free(copy);
  Ref number = Ref::steal(PyLong_FromLong(1));
  EXPECT_EQ(_pystring_to_c_string_copy(number.get()), nullptr);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

// ---- Frames -----------------------------------------------------------------------------

class FrameWalkTest : public coretest::PythonTest {};

std::string code_name(PyObject* frame) {
  Ref code = Ref::steal(
      reinterpret_cast<PyObject*>(PyFrame_GetCode(reinterpret_cast<PyFrameObject*>(frame))));
  const char* name = PyUnicode_AsUTF8(reinterpret_cast<PyCodeObject*>(code.get())->co_name);
  return name != nullptr ? name : "";
}

TEST_F(FrameWalkTest, BackAndDepthFollowTheRealStack) {
  Ref globals = coretest::make_namespace(
      "def outer():\n"
      "    return middle()\n"
      "def middle():\n"
      "    return inner()\n"
      "def inner():\n"
      "    return probe()\n"
      "def entry():\n"
      "    return outer()\n");
  std::string names;
  int depth = -1;
  int depth_of_tstate = -1;
  bool ran = coretest::run_in_frame(globals.get(), "entry", [&](PyFrameObject* f) {
    depth = get_stack_depth(nullptr);
    depth_of_tstate = get_stack_depth(PyThreadState_Get());
    Ref frame = Ref::borrow(reinterpret_cast<PyObject*>(f));
    for (; frame; frame = frame_back(frame.get())) names += code_name(frame.get()) + " ";
  });
  ASSERT_TRUE(ran);
  // Called from C: the entry function's frame is the outermost one.
  EXPECT_EQ(names, "inner middle outer entry ");
  EXPECT_EQ(depth, 4);
  EXPECT_EQ(depth_of_tstate, 4);
  EXPECT_EQ(get_stack_depth(nullptr), 0);
}

TEST_F(FrameWalkTest, BackOfANonFrameOrNullIsNull) {
  Ref number = Ref::steal(PyLong_FromLong(3));
  EXPECT_FALSE(frame_back(number.get()));
  EXPECT_FALSE(frame_back(nullptr));
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

TEST_F(FrameWalkTest, BackReturnsANewReference) {
  Ref globals = coretest::make_namespace(
      "def caller():\n"
      "    return callee()\n"
      "def callee():\n"
      "    return probe()\n");
  bool ran = coretest::run_in_frame(globals.get(), "caller", [&](PyFrameObject* f) {
    Ref back = frame_back(reinterpret_cast<PyObject*>(f));
    ASSERT_TRUE(back);
    const Py_ssize_t held = refs(back.get());
    {
      Ref again = frame_back(reinterpret_cast<PyObject*>(f));
      EXPECT_TRUE(again.is(back.get()));
      EXPECT_EQ(refs(back.get()), held + 1);
    }
    EXPECT_EQ(refs(back.get()), held);
  });
  EXPECT_TRUE(ran);
}

}  // namespace
