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

#include "common/interpreter_main.h"
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

}  // namespace testsupport

int main(int argc, char** argv) {
  return nativetest::run_tests_with_interpreter(argc, argv);
}
