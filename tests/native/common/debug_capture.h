// debug_capture.h: captures the core's debug print channel in an io.StringIO for the length
// of a test, with a chosen mask, and puts the channel back as it was afterwards. Shared by
// the native test executables that embed the interpreter.
#pragma once

#include <Python.h>
#include <gtest/gtest.h>

#include <string>

#include "support/dprintf.h"
#include "support/ref.h"

namespace nativetest {

class DebugCapture {
 public:
  explicit DebugCapture(unsigned int mask) : saved_mask_(gDPrintfMask) {
    Ref io = Ref::steal(PyImport_ImportModule("io"));
    EXPECT_TRUE(io);
    buffer_ = io ? Ref::steal(PyObject_CallMethod(io.get(), "StringIO", nullptr)) : Ref();
    EXPECT_TRUE(buffer_);
    set_dprintf_file(buffer_.get());
    gDPrintfMask = mask;
  }
  ~DebugCapture() {
    set_dprintf_file(nullptr);
    gDPrintfMask = saved_mask_;
  }
  DebugCapture(const DebugCapture&) = delete;
  DebugCapture& operator=(const DebugCapture&) = delete;

  // Everything written so far.
  std::string text() const {
    Ref value = Ref::steal(PyObject_CallMethod(buffer_.get(), "getvalue", nullptr));
    const char* utf8 = value ? PyUnicode_AsUTF8(value.get()) : nullptr;
    EXPECT_NE(utf8, nullptr);
    return utf8 != nullptr ? utf8 : "";
  }
  PyObject* file() const { return buffer_.get(); }

 private:
  Ref buffer_;
  unsigned int saved_mask_;
};

}  // namespace nativetest
