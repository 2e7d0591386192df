// test_dprintf.cpp: the debug print channel: which message classes the default mask lets
// through, the file's ownership, that printing never disturbs the program (pending
// exception, errors of the file itself, tracing), the text-check helpers, the formats the
// core uses, and the logging of the core's own exceptions.
#include "support/dprintf.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <string>

#include "core_test_support.h"
#include "support/dbgcommon.h"
#include "support/pycompat.h"

namespace {

using coretest::DebugCapture;
using coretest::refs;

constexpr unsigned int kDefaultMask = kDbgFlow | kDbgExceptions;

// A file whose write and flush raise, counting the calls that reached them.
constexpr const char* kFailingFileSource = R"(
class FailingFile:
    def __init__(self):
        self.writes = 0
        self.flushes = 0
    def write(self, text):
        self.writes += 1
        raise OSError('write refused')
    def flush(self):
        self.flushes += 1
        raise OSError('flush refused')

class RecordingFile:
    def __init__(self):
        self.parts = []
    def write(self, text):
        self.parts.append(text)
        return len(text)
    def flush(self):
        pass
)";

long int_attr(PyObject* obj, const char* name) {
  Ref value = Ref::steal(PyObject_GetAttrString(obj, name));
  EXPECT_TRUE(value) << name;
  return value ? PyLong_AsLong(value.get()) : -1;
}

Ref new_instance(PyObject* globals, const char* class_name) {
  Ref instance = Ref::steal(PyObject_CallNoArgs(coretest::item(globals, class_name)));
  EXPECT_TRUE(instance) << class_name;
  return instance;
}

// A ValueError instance raised from Python, so that it carries a traceback too.
Ref raised_value_error(const char* text) {
  Ref globals = coretest::make_namespace("def boom(t):\n    raise ValueError(t)\n");
  Ref arg = Ref::steal(PyUnicode_FromString(text));
  Ref result = Ref::steal(PyObject_CallOneArg(coretest::item(globals.get(), "boom"), arg.get()));
  EXPECT_FALSE(result);
  return coretest::take_pending_exception();
}

class DPrintfTest : public coretest::PythonTest {};

TEST_F(DPrintfTest, DefaultMaskWritesOnlyFlowAndExceptionClasses) {
  ASSERT_EQ(gDPrintfMask, kDefaultMask);
  DebugCapture capture(gDPrintfMask);
  for (unsigned int bit : {1u, 2u, 4u, 8u, 16u, 32u}) do_dprintf(bit, "class %u\n", bit);
  EXPECT_EQ(capture.text(), "class 4\nclass 16\n");
}

TEST_F(DPrintfTest, MessageOfSeveralClassesIsWrittenWhenAnyOfThemIsOn) {
  DebugCapture capture(kDefaultMask);
  do_dprintf(kDbgLookup | kDbgExceptions, "one of two\n");
  do_dprintf(kDbgLookup | kDbgPathnames, "none of two\n");
  EXPECT_EQ(capture.text(), "one of two\n");
}

TEST_F(DPrintfTest, NothingIsWrittenWithoutAFile) {
  ASSERT_EQ(gDPrintfFile, nullptr);
  do_dprintf(kDbgFlow, "nowhere\n");
  EXPECT_EQ(PyErr_Occurred(), nullptr);
  EXPECT_FALSE(dprintf_wanted(kDbgFlow));
}

TEST_F(DPrintfTest, FormatsPointerLongTextAndInts) {
  DebugCapture capture(kDbgFlow);
  int local = 0;
  void* pointer = &local;
  char expected_pointer[64];
  snprintf(expected_pointer, sizeof expected_pointer, "%p", pointer);
  do_dprintf(kDbgFlow, "p=%p ld=%ld s=%s d=%d i=%i\n", pointer, -1234567890123L, "text", -7, 42);
  EXPECT_EQ(capture.text(),
            std::string("p=") + expected_pointer + " ld=-1234567890123 s=text d=-7 i=42\n");
}

TEST_F(DPrintfTest, UnformattableMessageIsReplacedAndLeavesNoError) {
  DebugCapture capture(kDbgFlow);
  // %c beyond the last code point is refused by the interpreter's formatter.
  do_dprintf(kDbgFlow, "%c", 0x110000);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
  EXPECT_EQ(capture.text(), "DPRINTF error: unable to create output string\n");
}

TEST_F(DPrintfTest, MissingFormatterIsReportedInTheOutput) {
  DebugCapture capture(kDbgFlow);
  auto* saved = gPtrTo_PyUnicode_FormatV;
  gPtrTo_PyUnicode_FormatV = nullptr;
  do_dprintf(kDbgFlow, "lost %d\n", 1);
  gPtrTo_PyUnicode_FormatV = saved;
  EXPECT_EQ(capture.text(), "DPRINTF error:  gPtrTo_PyUnicode_FormatV is NULL\n");
}

TEST_F(DPrintfTest, PendingExceptionIsTheSameObjectAfterAPrint) {
  Ref exc = raised_value_error("pending across print");
  ASSERT_TRUE(exc);
  Ref tb = Ref::steal(PyException_GetTraceback(exc.get()));
  ASSERT_TRUE(tb);
  const Py_ssize_t exc_refs = refs(exc.get());
  DebugCapture capture(kDbgFlow);
  coretest::set_pending_exception(exc.get());
  do_dprintf(kDbgFlow, "while an error is pending\n");
  Ref after = coretest::take_pending_exception();
  EXPECT_TRUE(after.is(exc.get()));
  Ref tb_after = after ? Ref::steal(PyException_GetTraceback(after.get())) : Ref();
  EXPECT_TRUE(tb_after.is(tb.get()));
  after.reset();
  EXPECT_EQ(refs(exc.get()), exc_refs);
  EXPECT_EQ(capture.text(), "while an error is pending\n");
}

TEST_F(DPrintfTest, FailingWriteAndFlushNeitherReplaceNorClearThePendingException) {
  Ref globals = coretest::make_namespace(kFailingFileSource);
  Ref file = new_instance(globals.get(), "FailingFile");
  ASSERT_TRUE(file);
  Ref exc = raised_value_error("survives a failing file");
  set_dprintf_file(file.get());
  coretest::set_pending_exception(exc.get());
  do_dprintf(kDbgFlow, "refused\n");
  Ref after = coretest::take_pending_exception();
  set_dprintf_file(nullptr);
  EXPECT_TRUE(after.is(exc.get()));
  // Both were really called and both raised: the write's failure did not skip the flush.
  EXPECT_EQ(int_attr(file.get(), "writes"), 1);
  EXPECT_EQ(int_attr(file.get(), "flushes"), 1);
}

TEST_F(DPrintfTest, FailingFileLeavesNoErrorWhenNoneWasPending) {
  Ref globals = coretest::make_namespace(kFailingFileSource);
  Ref file = new_instance(globals.get(), "FailingFile");
  set_dprintf_file(file.get());
  do_dprintf(kDbgFlow, "refused\n");
  set_dprintf_file(nullptr);
  EXPECT_EQ(PyErr_Occurred(), nullptr);
  EXPECT_EQ(int_attr(file.get(), "flushes"), 1);
}

TEST_F(DPrintfTest, SettingNoneReleasesTheFileAndSilences) {
  Ref globals = coretest::make_namespace(kFailingFileSource);
  Ref file = new_instance(globals.get(), "RecordingFile");
  const Py_ssize_t before = refs(file.get());
  set_dprintf_file(file.get());
  EXPECT_EQ(gDPrintfFile, file.get());
  EXPECT_EQ(refs(file.get()), before + 1);
  set_dprintf_file(Py_None);
  EXPECT_EQ(gDPrintfFile, nullptr);
  EXPECT_EQ(refs(file.get()), before);
  do_dprintf(kDbgFlow, "after None\n");
  Ref parts = Ref::steal(PyObject_GetAttrString(file.get(), "parts"));
  ASSERT_TRUE(parts);
  EXPECT_EQ(PyList_Size(parts.get()), 0);
}

TEST_F(DPrintfTest, ReplacingTheFileReleasesThePreviousOne) {
  Ref globals = coretest::make_namespace(kFailingFileSource);
  Ref first = new_instance(globals.get(), "RecordingFile");
  Ref second = new_instance(globals.get(), "RecordingFile");
  const Py_ssize_t first_before = refs(first.get());
  set_dprintf_file(first.get());
  set_dprintf_file(second.get());
  EXPECT_EQ(refs(first.get()), first_before);
  EXPECT_EQ(gDPrintfFile, second.get());
  set_dprintf_file(nullptr);
}

TEST_F(DPrintfTest, CheckStrReplacesNonAsciiOnlyWhileAFileIsSet) {
  const char* non_ascii = "caf\xc3\xa9";
  const char* ascii = "plain";
  EXPECT_EQ(dprint_check_str(non_ascii), non_ascii);
  EXPECT_STREQ(dprint_check_str(nullptr), "(NULL)");
  DebugCapture capture(kDefaultMask);
  EXPECT_STREQ(dprint_check_str(non_ascii), "(non-ascii string)");
  EXPECT_STREQ(dprint_check_str("\x80"), "(non-ascii string)");
  EXPECT_EQ(dprint_check_str(ascii), ascii);
  EXPECT_STREQ(dprint_check_str(nullptr), "(NULL)");
}

TEST_F(DPrintfTest, CheckPyStrOfNullNonStrAndStr) {
  DebugCapture capture(kDefaultMask);
  EXPECT_STREQ(dprint_check_pystr(nullptr), "(NULL PyObject*)");
  Ref number = Ref::steal(PyLong_FromLong(7));
  EXPECT_STREQ(dprint_check_pystr(number.get()), "(non-PyString PyObject*)");
  Ref bytes = Ref::steal(PyBytes_FromString("bytes"));
  EXPECT_STREQ(dprint_check_pystr(bytes.get()), "(non-PyString PyObject*)");
  Ref text = Ref::steal(PyUnicode_FromString("name"));
  EXPECT_STREQ(dprint_check_pystr(text.get()), "name");
  Ref non_ascii = Ref::steal(PyUnicode_FromString("caf\xc3\xa9"));
  EXPECT_STREQ(dprint_check_pystr(non_ascii.get()), "(non-ascii string)");
  // A str subclass is a string too.
  Ref globals = coretest::make_namespace("class S(str): pass\nsub = S('derived')\n");
  EXPECT_STREQ(dprint_check_pystr(coretest::item(globals.get(), "sub")), "derived");
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

TEST_F(DPrintfTest, NoOutputWhileTheTracingCounterIsTwoOrMore) {
  DebugCapture capture(kDbgFlow);
  PyThreadState* ts = PyThreadState_Get();
  const int base = compat::tracing_get(ts);
  ASSERT_EQ(base, 0);
  compat::tracing_add(ts, 2);
  do_dprintf(kDbgFlow, "at two\n");
  compat::tracing_add(ts, 1);
  do_dprintf(kDbgFlow, "at three\n");
  compat::tracing_add(ts, -2);
  do_dprintf(kDbgFlow, "at one\n");
  compat::tracing_add(ts, -1);
  EXPECT_EQ(compat::tracing_get(ts), base);
  EXPECT_EQ(capture.text(), "at one\n");
}

TEST_F(DPrintfTest, TheFilesPythonCodeIsNotTraced) {
  Ref globals = coretest::make_namespace(kFailingFileSource);
  Ref file = new_instance(globals.get(), "RecordingFile");
  set_dprintf_file(file.get());
  Ref direct_arg = Ref::steal(PyUnicode_FromString("direct"));
  int direct_events = 0;
  int print_events = 0;
  {
    coretest::TraceCounter counter("write");
    // The same write called by us is traced: the counter sees it.
    Ref direct = Ref::steal(PyObject_CallMethod(file.get(), "write", "O", direct_arg.get()));
    EXPECT_TRUE(direct);
    direct_events = counter.watched_events();
    do_dprintf(kDbgFlow, "untraced\n");
    print_events = counter.watched_events() - direct_events;
  }
  set_dprintf_file(nullptr);
  EXPECT_GT(direct_events, 0);
  EXPECT_EQ(print_events, 0);
  EXPECT_EQ(compat::tracing_get(PyThreadState_Get()), 0);
}

// ---- Logging the core's own exceptions ----------------------------------------------------

class DLogExceptionTest : public coretest::PythonTest {};

TEST_F(DLogExceptionTest, WritesBannerAndTracebackAndLeavesTheExceptionPending) {
  Ref exc = raised_value_error("dlog-marker");
  ASSERT_TRUE(exc);
  Ref sys_stderr = Ref::borrow(PySys_GetObject("stderr"));
  DebugCapture capture(kDefaultMask);
  coretest::set_pending_exception(exc.get());
  DLOGEXCEPTION();
  Ref after = coretest::take_pending_exception();
  EXPECT_TRUE(after.is(exc.get()));
  EXPECT_EQ(PySys_GetObject("stderr"), sys_stderr.get());
  const std::string text = capture.text();
  EXPECT_EQ(text.rfind("EXCEPTION IN DEBUG TRACER:\n", 0), 0u) << text;
  EXPECT_NE(text.find("Traceback (most recent call last):"), std::string::npos) << text;
  EXPECT_NE(text.find("in boom"), std::string::npos) << text;
  EXPECT_NE(text.find("ValueError: dlog-marker"), std::string::npos) << text;
  EXPECT_EQ(compat::tracing_get(PyThreadState_Get()), 0);
}

TEST_F(DLogExceptionTest, LeavesSysLastAlone) {
  Ref exc = raised_value_error("not for sys.last");
  Ref sys = Ref::steal(PyImport_ImportModule("sys"));
  ASSERT_TRUE(sys);
  for (const char* name : {"last_type", "last_value", "last_traceback", "last_exc"}) {
    if (PyObject_HasAttrString(sys.get(), name)) PyObject_DelAttrString(sys.get(), name);
  }
  DebugCapture capture(kDefaultMask);
  coretest::set_pending_exception(exc.get());
  DLOGEXCEPTION();
  PyErr_Clear();
  EXPECT_NE(capture.text().find("not for sys.last"), std::string::npos);
  for (const char* name : {"last_type", "last_value", "last_traceback", "last_exc"}) {
    EXPECT_FALSE(PyObject_HasAttrString(sys.get(), name)) << name;
  }
}

TEST_F(DLogExceptionTest, NothingPendingWritesNothing) {
  DebugCapture capture(kDefaultMask);
  DLOGEXCEPTION();
  EXPECT_EQ(capture.text(), "");
  EXPECT_EQ(PyErr_Occurred(), nullptr);
}

TEST_F(DLogExceptionTest, WithoutStderrOnlyTheBannerIsWritten) {
  Ref exc = raised_value_error("no stderr");
  Ref saved_stderr = Ref::borrow(PySys_GetObject("stderr"));
  ASSERT_EQ(PySys_SetObject("stderr", Py_None), 0);
  {
    DebugCapture capture(kDefaultMask);
    coretest::set_pending_exception(exc.get());
    DLOGEXCEPTION();
    Ref after = coretest::take_pending_exception();
    EXPECT_TRUE(after.is(exc.get()));
    EXPECT_EQ(capture.text(), "EXCEPTION IN DEBUG TRACER:\n");
  }
  EXPECT_EQ(PySys_GetObject("stderr"), Py_None);
  ASSERT_EQ(PySys_SetObject("stderr", saved_stderr.get()), 0);
}

TEST_F(DLogExceptionTest, SilentAtTracingTwoAndStillPending) {
  Ref exc = raised_value_error("too deep");
  DebugCapture capture(kDefaultMask);
  PyThreadState* ts = PyThreadState_Get();
  compat::tracing_add(ts, 2);
  coretest::set_pending_exception(exc.get());
  DLOGEXCEPTION();
  compat::tracing_add(ts, -2);
  Ref after = coretest::take_pending_exception();
  EXPECT_TRUE(after.is(exc.get()));
  EXPECT_EQ(capture.text(), "");
}

// PyErr_Print would end the process on SystemExit; the child shows that logging one does not.
TEST_F(DLogExceptionTest, SystemExitIsLoggedNotObeyed) {
  EXPECT_EXIT(
      {
        DebugCapture capture(kDefaultMask);
        Ref code = Ref::steal(PyLong_FromLong(3));
        PyErr_SetObject(PyExc_SystemExit, code.get());
        DLOGEXCEPTION();
        const bool still_pending = PyErr_ExceptionMatches(PyExc_SystemExit) != 0;
        PyErr_Clear();
        const bool logged = capture.text().find("SystemExit: 3") != std::string::npos;
        std::_Exit(still_pending && logged ? 42 : 43);
      },
      ::testing::ExitedWithCode(42), "");
}

}  // namespace
