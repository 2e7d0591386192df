// test_main.cpp: starts the embedded interpreter once for all tests and holds the helpers of
// test_support.h that need a body.
//
// The interpreter is set up as the extension module is at load time: the core makes its
// strings through the two function pointers, so they are set before any test runs.
#include <Python.h>
#include <gtest/gtest.h>

#include <sys/time.h>

#include <cstdio>
#include <fstream>

#include "support/dbgcommon.h"
#include "test_support.h"

namespace testsupport {

void write_file(const std::string& path, const std::string& content) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << content;
  EXPECT_TRUE(out.good()) << path;
}

void set_mtime(const std::string& path, time_t seconds) {
  struct timeval times[2] = {{seconds, 0}, {seconds, 0}};
  EXPECT_EQ(utimes(path.c_str(), times), 0) << path;
}

DebugCapture::DebugCapture() : saved_mask_(gDPrintfMask) {
  Ref io = Ref::steal(PyImport_ImportModule("io"));
  EXPECT_TRUE(io);
  buffer_ = Ref::steal(PyObject_CallMethod(io.get(), "StringIO", nullptr));
  EXPECT_TRUE(buffer_);
  set_dprintf_file(buffer_.get());
  gDPrintfMask |= kDbgPathnames;
}

DebugCapture::~DebugCapture() {
  set_dprintf_file(nullptr);
  gDPrintfMask = saved_mask_;
}

std::string DebugCapture::text() const {
  Ref value = Ref::steal(PyObject_CallMethod(buffer_.get(), "getvalue", nullptr));
  const char* utf8 = value ? PyUnicode_AsUTF8(value.get()) : nullptr;
  EXPECT_NE(utf8, nullptr);
  return utf8 != nullptr ? utf8 : "";
}

}  // namespace testsupport

namespace {

class PythonEnvironment : public ::testing::Environment {
 public:
  void SetUp() override {
    Py_InitializeEx(0);
    gPtrTo_PyUnicode_FromString = PyUnicode_FromString;
    gPtrTo_PyUnicode_FormatV = PyUnicode_FromFormatV;
  }
  void TearDown() override { ASSERT_EQ(Py_FinalizeEx(), 0); }
};

}  // namespace

int main(int argc, char** argv) {
  ::testing::InitGoogleTest(&argc, argv);
  ::testing::AddGlobalTestEnvironment(new PythonEnvironment);
  return RUN_ALL_TESTS();
}
