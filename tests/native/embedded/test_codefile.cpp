// test_codefile.cpp: from code objects, module globals and frames to file names: the choice
// between __file__ and co_filename, the relative name kept in the table's buffer, a frame's
// full name (from the table or worked out), and the registration of an imported module.
#include "names/conames.h"

#include <gtest/gtest.h>

#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

#include "test_support.h"

namespace {

using testsupport::compile;
using testsupport::DebugCapture;
using testsupport::function_code;
using testsupport::item;
using testsupport::new_globals;
using testsupport::run_in;
using testsupport::ScopedCwd;
using testsupport::set_mtime;
using testsupport::TempDir;
using testsupport::write_file;

using CodeFileTest = testsupport::TableTest;

Ref str(const std::string& text) {
  return Ref::steal(PyUnicode_FromString(text.c_str()));
}

// The frame of a call to f() in code compiled as `filename`. New reference.
Ref function_frame(PyObject* globals, const std::string& filename) {
  run_in(globals, "import sys\ndef f():\n    return sys._getframe()\nfr = f()\n", filename);
  return Ref::borrow(item(globals, "fr"));
}

std::string text_or_null(const char* text) {
  return text != nullptr ? text : "(null)";
}

// ---- use_globals_name ----------------------------------------------------------------------

// Each check asks a stat cache of its own unless it says otherwise.
class UseGlobalsName : public ::testing::Test {
 protected:
  void TearDown() override {
    for (FileOpsData* cache : caches_) destroy_file_ops_data(cache);
  }
  FileOpsData* fresh_cache() {
    caches_.push_back(create_file_ops_data());
    return caches_.back();
  }
  int ask(const std::string& globals_file, const std::string& co_filename) {
    return use_globals_name(fresh_cache(), globals_file.c_str(), co_filename.c_str());
  }

 private:
  std::vector<FileOpsData*> caches_;
};

TEST_F(UseGlobalsName, MissingNames) {
  EXPECT_EQ(use_globals_name(fresh_cache(), nullptr, "/x/m.py"), 0);
  EXPECT_EQ(use_globals_name(fresh_cache(), nullptr, nullptr), 0);
  EXPECT_EQ(use_globals_name(fresh_cache(), "/x/m.py", nullptr), 1);
}

TEST_F(UseGlobalsName, EquivalentNamesKeepCodeName) {
  EXPECT_EQ(ask("/nowhere/m.pyc", "/nowhere/m.py"), 0);
}

TEST_F(UseGlobalsName, UnreadableCodeNamePrefersGlobals) {
  EXPECT_EQ(ask("/real/m.py", "/nonexistent/dir/m.py"), 1);
}

TEST_F(UseGlobalsName, CompiledCopyOfCodeFilePrefersGlobals) {
  TempDir temp;
  std::filesystem::create_directories(temp.file("build"));
  std::filesystem::create_directories(temp.file("src"));
  write_file(temp.file("build/m.py"), "x = 1\n");
  write_file(temp.file("src/m.py"), "y = 2\n");  // same size
  set_mtime(temp.file("build/m.py"), 1500000000);
  set_mtime(temp.file("src/m.py"), 1500000000);
  const std::string compiled = temp.file("build/m.pyc");
  const std::string code_file = temp.file("src/m.py");
  EXPECT_EQ(ask(compiled, code_file), 1);
  EXPECT_EQ(ask(temp.file("build/m.pyo"), code_file), 1);
  // Not a compiled name: the readable co_filename stands.
  EXPECT_EQ(ask(temp.file("build/m.py"), code_file), 0);
  set_mtime(temp.file("src/m.py"), 1500000001);
  EXPECT_EQ(ask(compiled, code_file), 0);
}

TEST_F(UseGlobalsName, DifferentSizeOrBasenameKeepsCodeName) {
  TempDir temp;
  std::filesystem::create_directories(temp.file("build"));
  write_file(temp.file("build/m.py"), "x = 1\n");
  write_file(temp.file("other.py"), "y = 2\n");
  write_file(temp.file("m.py"), "longer = 2\n");
  set_mtime(temp.file("build/m.py"), 1500000000);
  set_mtime(temp.file("other.py"), 1500000000);
  set_mtime(temp.file("m.py"), 1500000000);
  const std::string compiled = temp.file("build/m.pyc");
  EXPECT_EQ(ask(compiled, temp.file("other.py")), 0);
  EXPECT_EQ(ask(compiled, temp.file("m.py")), 0);
}

TEST_F(UseGlobalsName, OverlongGlobalsNameIsNotStatted) {
  TempDir temp;
  write_file(temp.file("m.py"), "x = 1\n");
  const std::string overlong = "/" + std::string(kMaxPathLen, 'd') + "/m.pyc";
  EXPECT_EQ(ask(overlong, temp.file("m.py")), 0);
}

// The answers come from the stat cache: what the files did after the first question is not
// seen by the same cache (a missing file stays missing for a while, a stat stays as it was),
// while a fresh cache sees it.
TEST_F(UseGlobalsName, FileChecksGoThroughTheStatCache) {
  TempDir temp;
  std::filesystem::create_directories(temp.file("build"));
  std::filesystem::create_directories(temp.file("src"));
  const std::string compiled = temp.file("build/m.pyc");
  const std::string code_file = temp.file("src/m.py");
  FileOpsData* cache = fresh_cache();
  EXPECT_EQ(use_globals_name(cache, compiled.c_str(), code_file.c_str()), 1);  // missing
  write_file(temp.file("build/m.py"), "x = 1\n");
  write_file(code_file, "y = 2\n");
  set_mtime(temp.file("build/m.py"), 1500000000);
  set_mtime(code_file, 1500000001);
  EXPECT_EQ(use_globals_name(cache, compiled.c_str(), code_file.c_str()), 1);
  EXPECT_EQ(ask(compiled, code_file), 0);  // exists, not the same file

  FileOpsData* warm = fresh_cache();
  EXPECT_EQ(use_globals_name(warm, compiled.c_str(), code_file.c_str()), 0);
  set_mtime(code_file, 1500000000);  // now a copy of the compiled file's source
  EXPECT_EQ(use_globals_name(warm, compiled.c_str(), code_file.c_str()), 0);
  EXPECT_EQ(ask(compiled, code_file), 1);
}

// ---- find_codefile and the relative name ---------------------------------------------------

TEST_F(CodeFileTest, StringCodeNameIsUsedAsItIs) {
  Ref globals = new_globals("/src/real.py");
  Ref name = str("<string>");
  EXPECT_STREQ(find_codefile(table(), globals.get(), name.get()), "<string>");
  EXPECT_STREQ(__tracer_get_relative_path(table(), globals.get(), name.get()), "<string>");
}

TEST_F(CodeFileTest, StaleCodeNameGivesWayToFile) {
  Ref globals = new_globals("/src/real.py");
  Ref name = str("/moved/away/real.py");
  EXPECT_STREQ(find_codefile(table(), globals.get(), name.get()), "/src/real.py");
}

TEST_F(CodeFileTest, ReadableCodeNameStands) {
  TempDir temp;
  write_file(temp.file("m.py"), "x = 1\n");
  Ref globals = new_globals("/elsewhere/other.py");
  Ref name = str(temp.file("m.py"));
  EXPECT_EQ(std::string(find_codefile(table(), globals.get(), name.get())), temp.file("m.py"));
}

TEST_F(CodeFileTest, NonStringNamesAreIgnored) {
  Ref globals = new_globals("");
  Ref bytes_file = Ref::steal(PyBytes_FromString("/src/b.py"));
  PyDict_SetItemString(globals.get(), "__file__", bytes_file.get());
  EXPECT_STREQ(find_codefile(table(), globals.get(), Py_None), "<string>");
  Ref with_file = new_globals("/src/g.py");
  EXPECT_STREQ(find_codefile(table(), with_file.get(), Py_None), "/src/g.py");
  Ref name = str("/moved/c.py");
  EXPECT_STREQ(find_codefile(table(), Py_None, name.get()), "/moved/c.py");
  EXPECT_STREQ(find_codefile(table(), nullptr, nullptr), "<string>");
}

TEST_F(CodeFileTest, RelativePathIsPrunedIntoTheBuffer) {
  Ref name = str("/nowhere/m.pyc");
  const char* relative = __tracer_get_relative_path(table(), nullptr, name.get());
  EXPECT_EQ(relative, table()->path_buffer);
  EXPECT_STREQ(relative, "/nowhere/m.py");
}

TEST_F(CodeFileTest, OverlongNameBecomesPlaceholder) {
  Ref fits = str("/" + std::string(kMaxPathLen - 1, 'f'));
  EXPECT_EQ(std::strlen(__tracer_get_relative_path(table(), nullptr, fits.get())),
            static_cast<size_t>(kMaxPathLen));
  Ref overlong = str("/" + std::string(kMaxPathLen, 'f'));
  DebugCapture capture;
  EXPECT_STREQ(__tracer_get_relative_path(table(), nullptr, overlong.get()), "<filename too long>");
  EXPECT_NE(capture.text().find("FAILURE: File name too long: <filename too long>\n"),
            std::string::npos);
}

// ---- A frame's full name -------------------------------------------------------------------

TEST_F(CodeFileTest, NonFrameIsACFrame) {
  EXPECT_STREQ(__tracer_get_full_path(table(), Py_None), "<cframe>");
  EXPECT_EQ(__tracer_get_full_path(table(), nullptr), nullptr);
}

TEST_F(CodeFileTest, RegisteredFrameCodeAnswersFromTable) {
  Ref globals = new_globals("/src/reg.py");
  Ref frame = function_frame(globals.get(), "/src/reg.py");
  ASSERT_TRUE(frame);
  PyObject* code = function_code(item(globals.get(), "f"));
  ASSERT_EQ(RegisterCOPathname(table(), code, "/registered/reg.py", nullptr, 0), 0);
  const Py_ssize_t frame_refs = Py_REFCNT(frame.get());
  const Py_ssize_t code_refs = Py_REFCNT(code);
  const char* full = __tracer_get_full_path(table(), frame.get());
  EXPECT_STREQ(full, "/registered/reg.py");
  EXPECT_EQ(full, LookupCOPathname(table(), code));
  EXPECT_EQ(Py_REFCNT(frame.get()), frame_refs);
  EXPECT_EQ(Py_REFCNT(code), code_refs);
}

TEST_F(CodeFileTest, UnregisteredFrameIsResolvedButNotRegistered) {
  TempDir temp;
  ScopedCwd cwd(temp.path());
  Ref globals = new_globals("");
  Ref frame = function_frame(globals.get(), "sub/m.pyc");
  ASSERT_TRUE(frame);
  EXPECT_EQ(text_or_null(__tracer_get_full_path(table(), frame.get())), temp.file("sub/m.py"));
  EXPECT_EQ(LookupCOPathname(table(), function_code(item(globals.get(), "f"))), nullptr);
  EXPECT_EQ(entry_count(), 0);
}

TEST_F(CodeFileTest, UnregisteredFramePrefersModuleFile) {
  Ref globals = new_globals("/src/actual.py");
  Ref frame = function_frame(globals.get(), "/old/location/actual.py");
  EXPECT_EQ(text_or_null(__tracer_get_full_path(table(), frame.get())), "/src/actual.py");
}

TEST_F(CodeFileTest, FullPathWithoutWorkingDirectoryFallsBackToRelative) {
  TempDir temp;
  const std::string gone = temp.file("gone");
  std::filesystem::create_directories(gone);
  ScopedCwd cwd(gone);
  std::filesystem::remove(gone);
  Ref globals = new_globals("");
  Ref frame = function_frame(globals.get(), "rel/m.py");
  DebugCapture capture;
  EXPECT_EQ(text_or_null(__tracer_get_full_path(table(), frame.get())), "rel/m.py");
  EXPECT_NE(capture.text().find("No full name found for relative name rel/m.py\n"),
            std::string::npos);
}

TEST_F(CodeFileTest, FullPathPrintsTheLookup) {
  Ref globals = new_globals("/src/p.py");
  Ref frame = function_frame(globals.get(), "/src/p.py");
  DebugCapture capture;
  __tracer_get_full_path(table(), frame.get());
  EXPECT_NE(capture.text().find("LookupCOPathname(f) => (NULL)\n"), std::string::npos)
      << capture.text();
}

// ---- Registering an imported module -------------------------------------------------------

TEST_F(CodeFileTest, ModuleWithCodeIsRegisteredWithForce) {
  Ref code = compile("def f():\n    pass\n", "/src/mod.py");
  Ref globals = new_globals("/src/mod.py");
  PyObject* co_filename = reinterpret_cast<PyCodeObject*>(code.get())->co_filename;
  ASSERT_EQ(RegisterCOPathname(table(), code.get(), "/stale/mod.py", nullptr, 0), 0);
  const char* full = __resolve_module_full_path(table(), globals.get(), co_filename, code.get());
  EXPECT_STREQ(full, "/src/mod.py");
  EXPECT_EQ(text_or_null(LookupCOPathname(table(), code.get())), "/src/mod.py");
  PyObject* nested = PyTuple_GET_ITEM(reinterpret_cast<PyCodeObject*>(code.get())->co_consts, 0);
  ASSERT_TRUE(PyCode_Check(nested));
  EXPECT_EQ(text_or_null(LookupCOPathname(table(), nested)), "/src/mod.py");
  // The forced registration pinned both; give the pins back.
  Py_DECREF(code.get());
  Py_DECREF(nested);
}

TEST_F(CodeFileTest, ModuleWithoutCodeRegistersItsFunctions) {
  TempDir temp;
  ScopedCwd cwd(temp.path());
  Ref globals = new_globals("pkg/mod.py");
  run_in(globals.get(), "def f(): pass\n", "pkg/mod.py");
  Ref name = str("pkg/mod.py");
  const char* full = __resolve_module_full_path(table(), globals.get(), name.get(), nullptr);
  EXPECT_EQ(text_or_null(full), temp.file("pkg/mod.py"));
  EXPECT_EQ(text_or_null(LookupCOPathname(table(), function_code(item(globals.get(), "f")))),
            temp.file("pkg/mod.py"));
}

TEST_F(CodeFileTest, PseudoFileNamesAreNotResolved) {
  Ref code = compile("x = 1\n", "<string>");
  Ref name = str("<string>");
  EXPECT_EQ(__resolve_module_full_path(table(), nullptr, name.get(), code.get()), nullptr);
  Ref stdin_name = str("<stdin>");
  EXPECT_EQ(__resolve_module_full_path(table(), nullptr, stdin_name.get(), code.get()), nullptr);
  EXPECT_EQ(entry_count(), 0);
}

}  // namespace
