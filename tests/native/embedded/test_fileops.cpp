// test_fileops.cpp: the file-system side of path names: textual resolution against the
// working directory, the full-name, stat and not-found caches (with a stepped clock), and
// the identity test of two file names.
#include "names/fileops.h"

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <string>

#include "test_support.h"

namespace {

using testsupport::DebugCapture;
using testsupport::ScopedClock;
using testsupport::ScopedCwd;
using testsupport::TempDir;
using testsupport::write_file;

std::string resolved(const char* dir, const char* name) {
  char* result = resolve_in_directory(dir, name);
  EXPECT_NE(result, nullptr);
  std::string text = result != nullptr ? result : "";
  std::free(result);
  return text;
}

class FileOpsTest : public testsupport::EmbeddedTest {
 protected:
  void SetUp() override {
    EmbeddedTest::SetUp();
    data_ = create_file_ops_data();
    ASSERT_NE(data_, nullptr);
  }
  void TearDown() override {
    destroy_file_ops_data(data_);
    EmbeddedTest::TearDown();
  }
  FileOpsData* data() { return data_; }

 private:
  FileOpsData* data_ = nullptr;
};

TEST(ResolveInDirectory, DotAndDotDotAreWorkedOut) {
  EXPECT_EQ(resolved("/x/y", "a/./b/../c"), "/x/y/a/c");
}

TEST(ResolveInDirectory, ClimbingAboveRootLosesTheRoot) {
  EXPECT_EQ(resolved("/x", "../../../z"), "z");
  EXPECT_EQ(resolved("/", ".."), "");
}

TEST(ResolveInDirectory, DoubleSeparatorsCollapse) {
  EXPECT_EQ(resolved("/x", "a//b"), "/x/a/b");
  EXPECT_EQ(resolved("/x/", "b"), "/x/b");
  EXPECT_EQ(resolved("/x", "."), "/x");
  EXPECT_EQ(resolved("/x/y", "../q/"), "/x/q");
}

TEST(ResolveInDirectory, LongNamesAreNotCut) {
  const std::string long_name(40000, 'n');
  EXPECT_EQ(resolved("/x", long_name.c_str()), "/x/" + long_name);
}

TEST_F(FileOpsTest, AbsnameResolvesAgainstWorkingDirectory) {
  TempDir temp;
  std::filesystem::create_directories(temp.file("x/y"));
  ScopedCwd cwd(temp.file("x/y"));
  const char* full = get_absname(data(), "a/./b/../c");
  ASSERT_NE(full, nullptr);
  EXPECT_EQ(std::string(full), temp.file("x/y/a/c"));
}

TEST_F(FileOpsTest, AbsnameIsCachedForTheLifeOfTheCaches) {
  TempDir temp;
  std::filesystem::create_directories(temp.file("one"));
  std::filesystem::create_directories(temp.file("two"));
  const char* first = nullptr;
  {
    ScopedCwd cwd(temp.file("one"));
    first = get_absname(data(), "m.py");
  }
  ScopedCwd cwd(temp.file("two"));
  EXPECT_EQ(get_absname(data(), "m.py"), first);
  EXPECT_EQ(std::string(first), temp.file("one/m.py"));
}

TEST_F(FileOpsTest, AbsoluteNameIsNotNormalised) {
  EXPECT_STREQ(get_absname(data(), "/p/../q"), "/p/../q");
}

TEST_F(FileOpsTest, AbsnameWithoutWorkingDirectoryIsNull) {
  TempDir temp;
  const std::string gone = temp.file("gone");
  std::filesystem::create_directories(gone);
  ScopedCwd cwd(gone);
  std::filesystem::remove(gone);
  EXPECT_EQ(get_absname(data(), "m.py"), nullptr);
}

TEST_F(FileOpsTest, AbsnamePrintsItsSteps) {
  DebugCapture capture;
  char* result = resolve_in_directory("/x/y", "a/./b/../c");
  std::free(result);
  const std::string text = capture.text();
  EXPECT_NE(text.find("In __posix_absname: resolving a/./b/../c in /x/y\n"), std::string::npos)
      << text;
  EXPECT_NE(text.find("parts[0] = \n"), std::string::npos) << text;
  EXPECT_NE(text.find("parts[3] = a\n"), std::string::npos) << text;
}

TEST_F(FileOpsTest, SamefilePrefixAnswersWithoutFileSystem) {
  EXPECT_EQ(samefile(data(), "/a/b", "/a/bc"), 1);
  EXPECT_EQ(samefile(data(), "/a/b", "/a/b"), 1);
  EXPECT_EQ(data()->stat_cache.num_entries, 0u);
  EXPECT_EQ(data()->not_found_cache.num_entries, 0u);
}

TEST_F(FileOpsTest, SamefileComparesDeviceAndInode) {
  TempDir temp;
  write_file(temp.file("f.py"), "x = 1\n");
  write_file(temp.file("other.py"), "x = 1\n");
  std::filesystem::create_hard_link(temp.file("f.py"), temp.file("hard.py"));
  std::filesystem::create_symlink(temp.file("f.py"), temp.file("link.py"));
  EXPECT_EQ(samefile(data(), temp.file("f.py").c_str(), temp.file("hard.py").c_str()), 1);
  EXPECT_EQ(samefile(data(), temp.file("link.py").c_str(), temp.file("f.py").c_str()), 1);
  EXPECT_EQ(samefile(data(), temp.file("f.py").c_str(), temp.file("other.py").c_str()), 0);
  EXPECT_EQ(samefile(data(), temp.file("f.py").c_str(), temp.file("missing.py").c_str()), 0);
}

TEST_F(FileOpsTest, SamefilePrefersTheCompiledFiles) {
  TempDir temp;
  std::filesystem::create_directories(temp.file("d"));
  std::filesystem::create_directories(temp.file("e"));
  write_file(temp.file("d/m.py"), "a = 1\n");
  write_file(temp.file("e/m.py"), "b = 2\n");
  write_file(temp.file("d/m.pyc"), "compiled");
  std::filesystem::create_hard_link(temp.file("d/m.pyc"), temp.file("e/m.pyc"));
  EXPECT_EQ(samefile(data(), temp.file("d/m.py").c_str(), temp.file("e/m.py").c_str()), 1);
}

TEST_F(FileOpsTest, SamefileFallsBackToNamesWithoutCompiledFiles) {
  TempDir temp;
  write_file(temp.file("a.py"), "a = 1\n");
  write_file(temp.file("b.py"), "b = 2\n");
  write_file(temp.file("a.pyc"), "compiled");  // only one side has a compiled file
  EXPECT_EQ(samefile(data(), temp.file("a.py").c_str(), temp.file("b.py").c_str()), 0);
  std::filesystem::create_hard_link(temp.file("a.py"), temp.file("c.py"));
  EXPECT_EQ(samefile(data(), temp.file("a.py").c_str(), temp.file("c.py").c_str()), 1);
}

TEST_F(FileOpsTest, StatResultsAreCachedAndNeverRefreshed) {
  TempDir temp;
  const std::string path = temp.file("s.py");
  write_file(path, "s = 1\n");
  const struct stat* first = __tracer_stat(data(), path.c_str());
  ASSERT_NE(first, nullptr);
  EXPECT_EQ(first->st_size, 6);
  std::filesystem::remove(path);
  EXPECT_EQ(__tracer_stat(data(), path.c_str()), first);
}

TEST_F(FileOpsTest, MissingFileIsRememberedForUnderThreeSeconds) {
  ScopedClock clock(1000);
  TempDir temp;
  const std::string path = temp.file("late.py");
  EXPECT_EQ(__tracer_stat(data(), path.c_str()), nullptr);
  write_file(path, "late = 1\n");
  ScopedClock::now = 1002;
  EXPECT_EQ(__tracer_stat(data(), path.c_str()), nullptr);  // no new stat yet
  ScopedClock::now = 1003;
  const struct stat* found = __tracer_stat(data(), path.c_str());
  ASSERT_NE(found, nullptr);
  EXPECT_EQ(found->st_size, 9);
  EXPECT_EQ(data()->not_found_cache.num_entries, 0u);
}

TEST_F(FileOpsTest, ClockGoingBackCountsLikeGoingForward) {
  ScopedClock clock(1000);
  mark_not_found(data(), "/nowhere/x.py");
  ScopedClock::now = 998;
  EXPECT_EQ(is_not_found(data(), "/nowhere/x.py"), 1);
  ScopedClock::now = 997;
  EXPECT_EQ(is_not_found(data(), "/nowhere/x.py"), 0);
  EXPECT_EQ(data()->not_found_cache.num_entries, 0u);
}

TEST_F(FileOpsTest, NotFoundWithoutEntryIsZero) {
  EXPECT_EQ(is_not_found(data(), "/never/asked.py"), 0);
}

TEST_F(FileOpsTest, MarkingAgainRestartsTheTimer) {
  ScopedClock clock(50);
  mark_not_found(data(), "/nowhere/y.py");
  ScopedClock::now = 52;
  mark_not_found(data(), "/nowhere/y.py");
  ScopedClock::now = 54;
  EXPECT_EQ(is_not_found(data(), "/nowhere/y.py"), 1);
  EXPECT_EQ(data()->not_found_cache.num_entries, 1u);
}

TEST(FileOpsClock, DefaultClockIsTheSystemTime) {
  const time_t before = time(nullptr);
  const time_t now = get_seconds();
  EXPECT_GE(now, before);
  EXPECT_LE(now, time(nullptr));
}

}  // namespace
