// fileops.h: the file-system side of path names and its caches.
//
// Stat results and full names are worked out once per name and kept for the life of the
// tracer; failed stats are remembered for under 3 seconds, so a file created later is seen
// soon while repeated questions about a missing file do not hit the file system.
#pragma once

#include <sys/stat.h>

#include <ctime>

#include "support/hashtable.h"

// Longest path name the tracer keeps in its fixed buffers (a terminator comes on top).
constexpr int kMaxPathLen = 32000;

// Path caches, all keyed by the name as given.
struct FileOpsData {
  CU_HashTable absname_cache;    // name -> malloc'ed full name (owned)
  CU_HashTable not_found_cache;  // path -> time of the failed stat, in the value word
  CU_HashTable stat_cache;       // path -> malloc'ed struct stat (owned)
};

FileOpsData* create_file_ops_data();
void destroy_file_ops_data(FileOpsData* data);

// The clock of the not-found cache, in whole seconds. Tests replace it to step time.
extern time_t (*gFileOpsClock)();
time_t get_seconds();

void mark_not_found(FileOpsData* data, const char* path);
// 1 while a stat of `path` failed less than 3 seconds ago; an older failure is forgotten.
int is_not_found(FileOpsData* data, const char* path);

// The cached stat result of `path` (borrowed from the cache), or null when it fails.
const struct stat* __tracer_stat(FileOpsData* data, const char* path);

// 1 when the two names denote the same file; see the comment at the definition.
int samefile(FileOpsData* data, const char* a, const char* b);

// Full name of `name`, resolved textually against the working directory and cached
// (owned by the cache). Null when the directory cannot be read or memory runs out.
const char* get_absname(FileOpsData* data, const char* name);

// The textual resolution behind get_absname: `name` appended to `dir`, with ".", empty
// pieces and ".." worked out. Malloc'ed (caller frees), or null when memory runs out.
char* resolve_in_directory(const char* dir, const char* name);
