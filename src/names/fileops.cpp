// fileops.cpp: stat results, recent stat failures and full names, each cached per name
// (see fileops.h).
//
// Only the first question about a name reaches the file system. Full names are worked out
// textually against the working directory: links are not followed and existence is not
// checked, so the answer is cheap and stable for the life of the tracer.
#include "names/fileops.h"

#include <unistd.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "names/pathtext.h"
#include "support/dprintf.h"

namespace {

// A failed stat is trusted for less than this many seconds.
constexpr time_t kNotFoundSeconds = 3;

time_t system_seconds() {
  return time(nullptr);
}

// `name` with "c" appended (the compiled file of a source name), malloc'ed. Built on the heap
// at the name's own length, so no name is too long for it.
char* with_compiled_suffix(const char* name) {
  const size_t length = std::strlen(name);
  char* compiled = static_cast<char*>(std::malloc(length + 2));
  if (compiled == nullptr) return nullptr;
  std::memcpy(compiled, name, length);
  compiled[length] = 'c';
  compiled[length + 1] = '\0';
  return compiled;
}

// Stats the compiled-file names of `a` and `b`; both results null unless both exist.
void stat_compiled_names(FileOpsData* data, const char* a, const char* b,
                         const struct stat** stat_a, const struct stat** stat_b) {
  *stat_a = *stat_b = nullptr;
  char* compiled_a = with_compiled_suffix(a);
  char* compiled_b = with_compiled_suffix(b);
  if (compiled_a != nullptr && compiled_b != nullptr) {
    *stat_a = __tracer_stat(data, compiled_a);
    *stat_b = __tracer_stat(data, compiled_b);
  }
  std::free(compiled_a);
  std::free(compiled_b);
}

// Works out "." and ".." and collapses "//" in a split absolute name, in place. The empty
// first piece stands for the root and stays, unless a ".." climbs above it.
void collapse_parts(char** parts) {
  int i = 0;
  while (parts[i] != nullptr) {
    do_dprintf(kDbgPathnames, "parts[%i] = %s\n", i, dprint_check_str(parts[i]));
    const char* part = parts[i];
    if (std::strcmp(part, ".") == 0 || (part[0] == '\0' && i > 0)) {
      __remove_from_string_array(parts, i);
    } else if (std::strcmp(part, "..") == 0) {
      __remove_from_string_array(parts, i);
      if (i > 0) __remove_from_string_array(parts, --i);
    } else {
      ++i;
    }
  }
}

// `name` resolved against the working directory; null when the directory cannot be read
// (removed, or longer than our buffer) or memory runs out. The buffer is on the heap:
// 32 KB would be too much for the small stacks some threads run on.
char* resolve_against_cwd(const char* name) {
  char* cwd = static_cast<char*>(std::malloc(kMaxPathLen + 1));
  if (cwd == nullptr) return nullptr;
  char* resolved =
      getcwd(cwd, kMaxPathLen + 1) != nullptr ? resolve_in_directory(cwd, name) : nullptr;
  std::free(cwd);
  return resolved;
}

// Stores `full` (taking it over) as the full name of `name`; the cached text, or null.
const char* remember_absname(FileOpsData* data, const char* name, char* full) {
  int is_new = 0;
  CU_HashEntry* entry = CU_CreateHashEntry(&data->absname_cache, name, &is_new);
  if (entry == nullptr) {
    std::free(full);
    return nullptr;
  }
  if (!is_new) std::free(CU_GetHashValue(entry));
  CU_SetHashValue(entry, full);
  do_dprintf(kDbgPathnames, "resolved %s to %s\n", dprint_check_str(name), dprint_check_str(full));
  return full;
}

}  // namespace

time_t (*gFileOpsClock)() = system_seconds;

FileOpsData* create_file_ops_data() {
  auto* data = static_cast<FileOpsData*>(std::malloc(sizeof(FileOpsData)));
  if (data == nullptr) return nullptr;
  CU_InitHashTable(&data->absname_cache, 0);
  CU_InitHashTable(&data->not_found_cache, 0);
  CU_InitHashTable(&data->stat_cache, 0);
  return data;
}

void destroy_file_ops_data(FileOpsData* data) {
  if (data == nullptr) return;
  CU_DeallocHashTable(&data->absname_cache);
  // Its values are times, not allocations.
  CU_DeleteHashTable(&data->not_found_cache);
  CU_DeallocHashTable(&data->stat_cache);
  std::free(data);
}

time_t get_seconds() {
  return gFileOpsClock();
}

void mark_not_found(FileOpsData* data, const char* path) {
  int is_new = 0;
  CU_HashEntry* entry = CU_CreateHashEntry(&data->not_found_cache, path, &is_new);
  // Without memory the failure is simply not remembered and the next question stats again.
  if (entry == nullptr) return;
  CU_SetHashValue(entry, reinterpret_cast<void*>(static_cast<intptr_t>(get_seconds())));
}

int is_not_found(FileOpsData* data, const char* path) {
  CU_HashEntry* entry = CU_FindHashEntry(&data->not_found_cache, path);
  if (entry == nullptr) return 0;
  const auto failed_at = static_cast<time_t>(reinterpret_cast<intptr_t>(CU_GetHashValue(entry)));
  const time_t age = get_seconds() - failed_at;
  // Either direction: a clock set back must not keep a file missing for long.
  if (age > -kNotFoundSeconds && age < kNotFoundSeconds) return 1;
  CU_DeleteHashEntry(entry);
  return 0;
}

const struct stat* __tracer_stat(FileOpsData* data, const char* path) {
  if (data == nullptr || path == nullptr) return nullptr;
  CU_HashEntry* cached = CU_FindHashEntry(&data->stat_cache, path);
  if (cached != nullptr) return static_cast<const struct stat*>(CU_GetHashValue(cached));
  if (is_not_found(data, path)) return nullptr;
  auto* result = static_cast<struct stat*>(std::malloc(sizeof(struct stat)));
  if (result == nullptr) return nullptr;
  if (stat(path, result) != 0) {
    std::free(result);
    mark_not_found(data, path);
    return nullptr;
  }
  int is_new = 0;
  CU_HashEntry* entry = CU_CreateHashEntry(&data->stat_cache, path, &is_new);
  if (entry == nullptr) {
    std::free(result);
    return nullptr;
  }
  CU_SetHashValue(entry, result);
  return result;
}

// `b` equal to `a`, or merely beginning with it, answers 1 without asking the file system;
// the prefix match is looser than file identity and is part of the contract. Otherwise the
// compiled files are compared first (a module may run from them), then the names as given.
int samefile(FileOpsData* data, const char* a, const char* b) {
  if (a == nullptr || b == nullptr) return 0;
  if (std::strncmp(b, a, std::strlen(a)) == 0) return 1;
  const struct stat* stat_a = nullptr;
  const struct stat* stat_b = nullptr;
  stat_compiled_names(data, a, b, &stat_a, &stat_b);
  if (stat_a == nullptr || stat_b == nullptr) {
    stat_a = __tracer_stat(data, a);
    stat_b = __tracer_stat(data, b);
  }
  if (stat_a == nullptr || stat_b == nullptr) return 0;
  return stat_a->st_dev == stat_b->st_dev && stat_a->st_ino == stat_b->st_ino ? 1 : 0;
}

const char* get_absname(FileOpsData* data, const char* name) {
  if (data == nullptr || name == nullptr) return nullptr;
  CU_HashEntry* cached = CU_FindHashEntry(&data->absname_cache, name);
  if (cached != nullptr) return static_cast<const char*>(CU_GetHashValue(cached));
  // Absolute names are kept as given, not normalised.
  char* full = name[0] == '/' ? strdup(name) : resolve_against_cwd(name);
  if (full == nullptr) return nullptr;
  return remember_absname(data, name, full);
}

char* resolve_in_directory(const char* dir, const char* name) {
  const size_t dir_length = std::strlen(dir);
  const size_t name_length = std::strlen(name);
  const bool dir_has_sep = dir_length > 0 && dir[dir_length - 1] == '/';
  // Sized from both lengths, so neither a long directory nor a long name can overflow it.
  char* joined = static_cast<char*>(std::malloc(dir_length + 1 + name_length + 1));
  if (joined == nullptr) return nullptr;
  std::memcpy(joined, dir, dir_length);
  size_t at = dir_length;
  if (!dir_has_sep) joined[at++] = '/';
  std::memcpy(joined + at, name, name_length + 1);
  do_dprintf(kDbgPathnames, "In __posix_absname: resolving %s in %s\n", dprint_check_str(name),
             dprint_check_str(dir));
  char** parts = __split_string(joined, '/');
  std::free(joined);
  if (parts == nullptr) return nullptr;
  collapse_parts(parts);
  char* resolved = __join_string(parts, '/');
  free_string_array(parts);
  return resolved;
}
