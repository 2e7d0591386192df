// test_support.h: helpers shared by the tests that embed the interpreter.
//
// The interpreter is started once for the whole run (test_main.cpp). Fixtures here give each
// test a fresh pathname table with its own caches, temporary directories, a controllable
// clock for the not-found cache, and a capture of the debug print channel.
#pragma once

#include <Python.h>
#include <gtest/gtest.h>

#include <unistd.h>

#include <ctime>
#include <filesystem>
#include <memory>
#include <string>

#include "common/debug_capture.h"
#include "names/conames.h"
#include "support/dprintf.h"
#include "support/ref.h"

namespace testsupport {

// Compiles `source` as a module named `filename`. New reference; fails the test on error.
inline Ref compile(const std::string& source, const std::string& filename) {
  Ref code = Ref::steal(Py_CompileString(source.c_str(), filename.c_str(), Py_file_input));
  if (!code) PyErr_Print();
  EXPECT_TRUE(code) << "could not compile " << filename;
  return code;
}

// A fresh module namespace with builtins and, unless empty, `__file__` set.
inline Ref new_globals(const std::string& dunder_file) {
  Ref globals = Ref::steal(PyDict_New());
  PyDict_SetItemString(globals.get(), "__builtins__", PyEval_GetBuiltins());
  if (!dunder_file.empty()) {
    Ref file = Ref::steal(PyUnicode_FromString(dunder_file.c_str()));
    PyDict_SetItemString(globals.get(), "__file__", file.get());
  }
  return globals;
}

// Runs `source` compiled as `filename` in `globals`; fails the test on error.
inline void run_in(PyObject* globals, const std::string& source,
                   const std::string& filename = "<test>") {
  Ref code = compile(source, filename);
  if (!code) return;
  Ref result = Ref::steal(PyEval_EvalCode(code.get(), globals, globals));
  if (!result) PyErr_Print();
  EXPECT_TRUE(result) << "running " << filename << " failed";
}

// globals[name], borrowed from `globals` (null when missing).
inline PyObject* item(PyObject* globals, const char* name) {
  return PyDict_GetItemString(globals, name);
}

inline PyObject* function_code(PyObject* function) {
  return PyFunction_GetCode(function);
}

// A directory under the system's temporary directory, removed with its contents at the end.
class TempDir {
 public:
  TempDir() {
    std::string pattern = (std::filesystem::temp_directory_path() / "conames-XXXXXX").string();
    path_ = mkdtemp(pattern.data()) != nullptr ? pattern : std::string();
    EXPECT_FALSE(path_.empty());
    // The canonical form is what getcwd reports after a chdir into it.
    path_ = std::filesystem::canonical(path_).string();
  }
  ~TempDir() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;

  const std::string& path() const { return path_; }
  std::string file(const std::string& relative) const { return path_ + "/" + relative; }

 private:
  std::string path_;
};

void write_file(const std::string& path, const std::string& content);
// Sets the modification time of `path` to `seconds` since the epoch.
void set_mtime(const std::string& path, time_t seconds);

// Changes the working directory for its scope.
class ScopedCwd {
 public:
  explicit ScopedCwd(const std::string& dir) : saved_(std::filesystem::current_path()) {
    EXPECT_EQ(chdir(dir.c_str()), 0) << dir;
  }
  ~ScopedCwd() { std::filesystem::current_path(saved_); }
  ScopedCwd(const ScopedCwd&) = delete;
  ScopedCwd& operator=(const ScopedCwd&) = delete;

 private:
  std::filesystem::path saved_;
};

// Makes the not-found cache's clock read `now` for its scope.
class ScopedClock {
 public:
  explicit ScopedClock(time_t start) : saved_(gFileOpsClock) {
    now = start;
    gFileOpsClock = [] { return now; };
  }
  ~ScopedClock() { gFileOpsClock = saved_; }
  ScopedClock(const ScopedClock&) = delete;
  ScopedClock& operator=(const ScopedClock&) = delete;

  static inline time_t now = 0;

 private:
  time_t (*saved_)();
};

// Captures the debug channel with the path-name messages switched on.
class DebugCapture : public nativetest::DebugCapture {
 public:
  DebugCapture() : nativetest::DebugCapture(gDPrintfMask | kDbgPathnames) {}
};

// Every test runs with the interpreter up and leaves no Python error behind.
class EmbeddedTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(PyErr_Occurred(), nullptr); }
  void TearDown() override {
    if (PyErr_Occurred() != nullptr) {
      PyErr_Print();
      ADD_FAILURE() << "a Python error was left pending";
    }
  }
};

// A fresh pathname table with its own caches; the table's references are released at the end.
class TableTest : public EmbeddedTest {
 protected:
  void SetUp() override {
    EmbeddedTest::SetUp();
    file_ops_ = create_file_ops_data();
    ASSERT_NE(file_ops_, nullptr);
    table_ = std::make_unique<COPathnameTable>();
    InitCOPathnameTable(table_.get(), file_ops_);
  }
  void TearDown() override {
    ClearCOPathnameTable(table_.get());
    table_.reset();
    destroy_file_ops_data(file_ops_);
    EmbeddedTest::TearDown();
  }

  COPathnameTable* table() { return table_.get(); }
  FileOpsData* file_ops() { return file_ops_; }
  Py_ssize_t entry_count() { return table_->dict ? PyDict_Size(table_->dict.get()) : 0; }
  // Runs lookups until the next sweep has happened.
  void run_sweep() {
    const int32_t remaining = 5000 - table_->sweep_counter;
    for (int32_t i = 0; i < remaining; ++i) LookupCOPathname(table_.get(), nullptr);
    ASSERT_EQ(table_->sweep_counter, 0);
  }

 private:
  FileOpsData* file_ops_ = nullptr;
  std::unique_ptr<COPathnameTable> table_;
};

}  // namespace testsupport
