// interpreter_main.h: the main() of the native test executables that embed the interpreter:
// one interpreter for the whole run, set up the way loading the extension module does
// (the string makers, then whatever else `prepare` does), and finalised cleanly at the end.
#pragma once

#include <Python.h>
#include <gtest/gtest.h>

#include "support/dbgcommon.h"

namespace nativetest {

class PythonEnvironment : public ::testing::Environment {
 public:
  explicit PythonEnvironment(void (*prepare)()) : prepare_(prepare) {}
  void SetUp() override {
    Py_InitializeEx(0);
    gPtrTo_PyUnicode_FromString = PyUnicode_FromString;
    gPtrTo_PyUnicode_FormatV = PyUnicode_FromFormatV;
    if (prepare_ != nullptr) prepare_();
  }
  void TearDown() override { ASSERT_EQ(Py_FinalizeEx(), 0); }

 private:
  void (*prepare_)();
};

inline int run_tests_with_interpreter(int argc, char** argv, void (*prepare)() = nullptr) {
  ::testing::InitGoogleTest(&argc, argv);
  ::testing::AddGlobalTestEnvironment(new PythonEnvironment(prepare));
  return RUN_ALL_TESTS();
}

}  // namespace nativetest
