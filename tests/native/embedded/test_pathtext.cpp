// test_pathtext.cpp: the pure text helpers of path names: separators, base names, the
// source/compiled name comparison, suffix pruning and the string arrays of path resolution.
#include "names/pathtext.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <vector>

namespace {

std::vector<std::string> pieces(char** parts) {
  std::vector<std::string> result;
  for (char** p = parts; *p != nullptr; ++p) result.emplace_back(*p);
  return result;
}

std::string pruned(std::string text) {
  prune_py_c_or_o(text.data());
  return text.c_str();
}

TEST(PathText, DirSeparatorsAreSlashAndBackslash) {
  EXPECT_EQ(is_dir_sep('/'), 1);
  EXPECT_EQ(is_dir_sep('\\'), 1);
  EXPECT_EQ(is_dir_sep(':'), 0);
  EXPECT_EQ(is_dir_sep('a'), 0);
}

TEST(PathText, BasenameIsAfterLastSeparatorWithText) {
  EXPECT_STREQ(find_basename("/x/y/mod.py"), "mod.py");
  EXPECT_STREQ(find_basename("mod.py"), "mod.py");
  EXPECT_STREQ(find_basename("dir\\mod.py"), "mod.py");
  EXPECT_STREQ(find_basename(""), "");
}

TEST(PathText, BasenameOfTrailingSeparatorIsWholeText) {
  const char* text = "a/";
  EXPECT_EQ(find_basename(text), text);
  EXPECT_STREQ(find_basename("x/a/"), "a/");
}

TEST(PathText, NamesEquivalentWithCompiledSuffix) {
  EXPECT_EQ(py_names_equiv("mod.py", "mod.pyc"), 1);
  EXPECT_EQ(py_names_equiv("mod.pyc", "mod.py"), 1);
  EXPECT_EQ(py_names_equiv("mod.py", "mod.pyO"), 1);
  EXPECT_EQ(py_names_equiv("mod.py", "mod.py"), 1);
}

TEST(PathText, NamesShorterThanThreeNeverEquivalent) {
  EXPECT_EQ(py_names_equiv("ab", "abc"), 0);
  EXPECT_EQ(py_names_equiv("ab", "ab"), 0);
}

TEST(PathText, LongerNameNeedOnlyContinueWithCOrO) {
  EXPECT_EQ(py_names_equiv("mod.py", "mod.pycache"), 1);
  EXPECT_EQ(py_names_equiv("mod.py", "mod.pyx"), 0);
  EXPECT_EQ(py_names_equiv("mod.py", "mud.py"), 0);
}

TEST(PathText, NullNamesNeverEquivalent) {
  EXPECT_EQ(py_names_equiv(nullptr, "mod.py"), 0);
  EXPECT_EQ(py_names_equiv("mod.py", nullptr), 0);
}

TEST(PathText, PruneDropsCompiledSuffixInAnyCase) {
  EXPECT_EQ(pruned("/x/mod.pyc"), "/x/mod.py");
  EXPECT_EQ(pruned("mod.PYO"), "mod.PY");
  EXPECT_EQ(pruned(".pyc"), ".py");
  EXPECT_EQ(pruned("pyc"), "pyc");
  EXPECT_EQ(pruned("mod.py"), "mod.py");
  EXPECT_EQ(pruned("mod.pyx"), "mod.pyx");
  EXPECT_EQ(pruned("mod.xpyc"), "mod.xpyc");
}

TEST(PathText, SplitKeepsEmptyPieces) {
  char** parts = __split_string("/a//b/", '/');
  ASSERT_NE(parts, nullptr);
  EXPECT_EQ(pieces(parts), (std::vector<std::string>{"", "a", "", "b", ""}));
  free_string_array(parts);
}

TEST(PathText, SplitOfEmptyTextIsOneEmptyPiece) {
  char** parts = __split_string("", '/');
  ASSERT_NE(parts, nullptr);
  EXPECT_EQ(pieces(parts), std::vector<std::string>{""});
  free_string_array(parts);
}

TEST(PathText, SplitGrowsPastSeveralSteps) {
  std::string text = "p0";
  std::vector<std::string> expected{"p0"};
  for (int i = 1; i < 35; ++i) {
    text += "/p" + std::to_string(i);
    expected.push_back("p" + std::to_string(i));
  }
  char** parts = __split_string(text.c_str(), '/');
  ASSERT_NE(parts, nullptr);
  EXPECT_EQ(pieces(parts), expected);
  char* joined = __join_string(parts, '/');
  EXPECT_EQ(std::string(joined), text);
  std::free(joined);
  free_string_array(parts);
}

TEST(PathText, JoinPutsSeparatorBetweenPieces) {
  char** parts = __split_string("/x/y", '/');
  ASSERT_NE(parts, nullptr);
  char* joined = __join_string(parts, ':');
  EXPECT_STREQ(joined, ":x:y");
  std::free(joined);
  free_string_array(parts);
}

TEST(PathText, RemoveMovesLaterPiecesDown) {
  char** parts = __split_string("a/b/c/d", '/');
  ASSERT_NE(parts, nullptr);
  __remove_from_string_array(parts, 1);
  EXPECT_EQ(pieces(parts), (std::vector<std::string>{"a", "c", "d"}));
  __remove_from_string_array(parts, 2);
  EXPECT_EQ(pieces(parts), (std::vector<std::string>{"a", "c"}));
  __remove_from_string_array(parts, 0);
  __remove_from_string_array(parts, 0);
  EXPECT_EQ(parts[0], nullptr);
  char* joined = __join_string(parts, '/');
  EXPECT_STREQ(joined, "");
  std::free(joined);
  free_string_array(parts);
}

}  // namespace
