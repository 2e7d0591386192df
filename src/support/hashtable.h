// Chained hash table used by every keyed table of the tracer core.
// Keys are either NUL-terminated text (key type 0) or byte arrays of a fixed
// length (key type N > 0, e.g. 8 for a pointer given by its address). The
// first four buckets live inside the table record; the table grows by four.
// Memory comes from malloc/free; no Python objects, no locks.
#pragma once

#include <cstddef>
#include <cstdint>

struct CU_HashTable;

// One allocation: these fields, then the key bytes directly after the struct
// (the text and its NUL for string keys, key_type bytes for array keys).
struct CU_HashEntry {
  CU_HashEntry* next;     // next entry in the same chain, null at the end
  CU_HashTable* table;    // owning table
  CU_HashEntry** bucket;  // the bucket slot whose chain holds this entry
  void* value;            // caller's value, null when created
};

using CU_FindProc = CU_HashEntry* (*)(CU_HashTable* table, const void* key);
using CU_CreateProc = CU_HashEntry* (*)(CU_HashTable* table, const void* key, int* is_new);

// Lives inside its owner and is never moved: `buckets` may point into it.
struct CU_HashTable {
  CU_HashEntry** buckets;           // bucket heads; static_buckets until growth
  CU_HashEntry* static_buckets[4];  // the first four heads, inside the record
  uint32_t num_buckets;             // 4 at start, a power of 4
  uint32_t num_entries;
  uint32_t rebuild_size;  // grow when num_entries reaches this
  int32_t down_shift;     // right shift of the array-key index
  uint32_t mask;          // num_buckets - 1
  int32_t key_type;       // 0: strings; N > 0: arrays of N bytes
  CU_FindProc find_proc;
  CU_CreateProc create_proc;
  // Private. The count may exceed the array after a failed growth; walks are
  // bounded by the real array, whose length is kept here.
  uint32_t allocated_buckets;
};

// Iteration cursor, usually on the caller's stack. It always holds the entry
// it will return next, so the entry returned last may be deleted.
struct CU_HashSearch {
  CU_HashTable* table;
  uint32_t next_index;       // next bucket to visit
  CU_HashEntry* next_entry;  // entry to return next, or null
};

void CU_InitHashTable(CU_HashTable* table, int32_t key_type);

CU_HashEntry* CU_StringFind(CU_HashTable* table, const void* key);
CU_HashEntry* CU_StringCreate(CU_HashTable* table, const void* key, int* is_new);
CU_HashEntry* CU_ArrayFind(CU_HashTable* table, const void* key);
CU_HashEntry* CU_ArrayCreate(CU_HashTable* table, const void* key, int* is_new);
// Installed on deleted tables: every lookup answers "not found".
CU_HashEntry* CU_BogusFind(CU_HashTable* table, const void* key);
CU_HashEntry* CU_BogusCreate(CU_HashTable* table, const void* key, int* is_new);

void CU_DeleteHashEntry(CU_HashEntry* entry);
void CU_DeallocHashEntry(CU_HashEntry* entry);  // also frees the value
void CU_DeleteHashTable(CU_HashTable* table);
void CU_DeallocHashTable(CU_HashTable* table);  // also frees the values

CU_HashEntry* CU_FirstHashEntry(CU_HashTable* table, CU_HashSearch* search);
CU_HashEntry* CU_NextHashEntry(CU_HashSearch* search);

// Chain-length statistics as malloc'ed text (caller frees), or null.
char* CU_HashStats(CU_HashTable* table);
uint32_t CU_HashString(const char* text);
// Grows the table by four; called by the create operations only.
void CU_RebuildTable(CU_HashTable* table);

// Allocators for bucket arrays and entries. They exist for tests of
// allocation failure; both default to malloc.
extern void* (*CU_BucketAlloc)(size_t size);
extern void* (*CU_EntryAlloc)(size_t size);

inline CU_HashEntry* CU_FindHashEntry(CU_HashTable* table, const void* key) {
  return table->find_proc(table, key);
}
inline CU_HashEntry* CU_CreateHashEntry(CU_HashTable* table, const void* key, int* is_new) {
  return table->create_proc(table, key, is_new);
}
inline void* CU_GetHashValue(const CU_HashEntry* entry) {
  return entry->value;
}
inline void CU_SetHashValue(CU_HashEntry* entry, void* value) {
  entry->value = value;
}
// The key bytes stored right after the entry's fields.
inline const char* CU_GetHashKey(const CU_HashEntry* entry) {
  return reinterpret_cast<const char*>(entry + 1);
}
