// pathtext.cpp: pure text operations on path names (see pathtext.h).
//
// No interpreter, no file system: only bytes. The string arrays are the working form of
// path resolution in fileops.cpp; every allocation failure gives a null result and frees
// what was made so far.
#include "names/pathtext.h"

#include <cctype>
#include <cstdlib>
#include <cstring>

#include <strings.h>

namespace {

// The arrays grow in steps of this many slots; most path names have fewer pieces.
constexpr int kArrayGrowth = 10;

bool is_compiled_suffix_char(char c) {
  const int lower = std::tolower(static_cast<unsigned char>(c));
  return lower == 'c' || lower == 'o';
}

char* copy_range(const char* start, size_t length) {
  char* piece = static_cast<char*>(std::malloc(length + 1));
  if (piece == nullptr) return nullptr;
  std::memcpy(piece, start, length);
  piece[length] = '\0';
  return piece;
}

// Makes room for one more piece plus the terminator; false when memory runs out.
bool ensure_slot(char*** parts, int count, int* capacity) {
  if (count + 1 < *capacity) return true;
  const int grown = *capacity + kArrayGrowth;
  void* resized = std::realloc(*parts, sizeof(char*) * static_cast<size_t>(grown));
  if (resized == nullptr) return false;
  *parts = static_cast<char**>(resized);
  *capacity = grown;
  return true;
}

}  // namespace

int is_dir_sep(char c) {
  return c == '/' || c == '\\' ? 1 : 0;
}

const char* find_basename(const char* text) {
  const char* base = text;
  for (const char* p = text; *p != '\0'; ++p) {
    if (is_dir_sep(*p) && p[1] != '\0') base = p + 1;
  }
  return base;
}

// The longer name only has to go on with "c" or "o" after the shorter one, not to end
// there: "mod.py" matches "mod.pycache". Callers rely on this loose rule, so it stays.
int py_names_equiv(const char* a, const char* b) {
  if (a == nullptr || b == nullptr) return 0;
  const size_t len_a = std::strlen(a);
  const size_t len_b = std::strlen(b);
  const size_t shorter = len_a < len_b ? len_a : len_b;
  if (shorter < 3) return 0;
  if (std::memcmp(a, b, shorter) != 0) return 0;
  if (len_a == len_b) return 1;
  const char* longer = len_a > len_b ? a : b;
  return is_compiled_suffix_char(longer[shorter]) ? 1 : 0;
}

void prune_py_c_or_o(char* text) {
  const size_t length = std::strlen(text);
  if (length <= 3) return;
  char* suffix = text + length - 4;
  if (strncasecmp(suffix, ".py", 3) == 0 && is_compiled_suffix_char(suffix[3])) {
    text[length - 1] = '\0';
  }
}

char** __split_string(const char* text, char sep) {
  int capacity = 0;
  int count = 0;
  char** parts = nullptr;
  const char* start = text;
  for (;;) {
    const char* end = std::strchr(start, sep);
    const size_t length = end != nullptr ? static_cast<size_t>(end - start) : std::strlen(start);
    if (!ensure_slot(&parts, count, &capacity)) break;
    parts[count] = copy_range(start, length);
    if (parts[count] == nullptr) break;
    parts[++count] = nullptr;
    if (end == nullptr) return parts;
    start = end + 1;
  }
  // Out of memory: the array (when there is one) is terminated after the last good piece.
  if (parts != nullptr) parts[count] = nullptr;
  free_string_array(parts);
  return nullptr;
}

char* __join_string(char** parts, char sep) {
  size_t total = 1;
  for (char** p = parts; *p != nullptr; ++p) total += std::strlen(*p) + 1;
  char* joined = static_cast<char*>(std::malloc(total));
  if (joined == nullptr) return nullptr;
  char* out = joined;
  for (char** p = parts; *p != nullptr; ++p) {
    if (p != parts) *out++ = sep;
    const size_t length = std::strlen(*p);
    std::memcpy(out, *p, length);
    out += length;
  }
  *out = '\0';
  return joined;
}

void __remove_from_string_array(char** parts, int index) {
  std::free(parts[index]);
  int i = index;
  do {
    parts[i] = parts[i + 1];
  } while (parts[i++] != nullptr);
}

void free_string_array(char** parts) {
  if (parts == nullptr) return;
  for (char** p = parts; *p != nullptr; ++p) std::free(*p);
  std::free(parts);
}
