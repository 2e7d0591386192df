// Chained hash table: string and fixed-length byte-array keys, bucket index
// computation, find/create, deletion, iteration, growth and statistics.
// Entries and their keys are single malloc blocks; the first four bucket
// heads live inside the table record so small tables allocate no array.
#include "support/hashtable.h"

#include <cassert>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace {

void* SystemAlloc(size_t size) {
  return std::malloc(size);
}

// The key starts right after the fixed fields; keeping the struct size a
// multiple of a pointer keeps word-sized keys aligned too.
static_assert(sizeof(CU_HashEntry) % alignof(void*) == 0);

char* KeyBytes(CU_HashEntry* entry) {
  return reinterpret_cast<char*>(entry + 1);
}

constexpr uint32_t kArrayKeyMultiplier = 1103515245u;  // 0x41C64E6D
constexpr size_t kStatsTextSize = 900;
constexpr int kStatsCounters = 10;

// The text hash is all the mixing string keys get: the index is its low bits.
uint32_t StringIndex(const CU_HashTable* table, const void* key) {
  return CU_HashString(static_cast<const char*>(key)) & table->mask;
}

// Byte order does not matter to the sum, so permuted keys share a bucket.
uint32_t ArrayIndex(const CU_HashTable* table, const void* key) {
  const auto* bytes = static_cast<const signed char*>(key);
  uint32_t sum = 0;
  for (int32_t i = 0; i < table->key_type; ++i) sum += static_cast<uint32_t>(bytes[i]);
  const auto product = static_cast<int32_t>(sum * kArrayKeyMultiplier);
  const auto shifted = product >> (table->down_shift & 31);  // arithmetic shift
  return static_cast<uint32_t>(shifted) & table->mask;
}

uint32_t IndexOf(const CU_HashTable* table, const void* key) {
  const uint32_t index = table->key_type == 0 ? StringIndex(table, key) : ArrayIndex(table, key);
  assert(index < table->allocated_buckets);
  return index;
}

size_t KeySize(const CU_HashTable* table, const void* key) {
  if (table->key_type == 0) return std::strlen(static_cast<const char*>(key)) + 1;
  return static_cast<size_t>(table->key_type);
}

// strcmp for text: it stops at the stored key's NUL and never reads past it.
bool KeyMatches(const CU_HashTable* table, CU_HashEntry* entry, const void* key) {
  if (table->key_type == 0) return std::strcmp(KeyBytes(entry), static_cast<const char*>(key)) == 0;
  return std::memcmp(KeyBytes(entry), key, static_cast<size_t>(table->key_type)) == 0;
}

CU_HashEntry* FindInChain(const CU_HashTable* table, uint32_t index, const void* key) {
  for (CU_HashEntry* entry = table->buckets[index]; entry != nullptr; entry = entry->next) {
    if (KeyMatches(table, entry, key)) return entry;
  }
  return nullptr;
}

void PushOnChain(CU_HashEntry** slot, CU_HashEntry* entry) {
  entry->next = *slot;
  entry->bucket = slot;
  *slot = entry;
}

CU_HashEntry* FindOrCreate(CU_HashTable* table, const void* key, int* is_new) {
  const uint32_t index = IndexOf(table, key);
  if (CU_HashEntry* found = FindInChain(table, index, key)) {
    *is_new = 0;
    return found;
  }
  *is_new = 1;
  const size_t key_size = KeySize(table, key);
  auto* entry = static_cast<CU_HashEntry*>(CU_EntryAlloc(sizeof(CU_HashEntry) + key_size));
  if (entry == nullptr) return nullptr;
  entry->table = table;
  entry->value = nullptr;
  std::memcpy(KeyBytes(entry), key, key_size);
  PushOnChain(&table->buckets[index], entry);
  if (++table->num_entries >= table->rebuild_size) CU_RebuildTable(table);
  return entry;
}

// Buckets an iteration may visit: the count, but never beyond the real array.
uint32_t WalkLimit(const CU_HashTable* table) {
  return table->num_buckets < table->allocated_buckets ? table->num_buckets
                                                       : table->allocated_buckets;
}

// A new array too short for the grown mask (the count wrapped after repeated
// failed growths) is refused like a failed allocation, so indexes stay in it.
CU_HashEntry** AllocBuckets(uint32_t count, uint32_t old_mask) {
  if (static_cast<uint64_t>(old_mask) * 4 + 4 > count) return nullptr;
  return static_cast<CU_HashEntry**>(CU_BucketAlloc(count * sizeof(CU_HashEntry*)));
}

void MoveEntries(CU_HashTable* table, CU_HashEntry** old_buckets, uint32_t old_count) {
  for (uint32_t i = 0; i < old_count; ++i) {
    while (CU_HashEntry* entry = old_buckets[i]) {
      old_buckets[i] = entry->next;
      PushOnChain(&table->buckets[IndexOf(table, KeyBytes(entry))], entry);
    }
  }
}

void UnlinkEntry(CU_HashEntry* entry) {
  CU_HashEntry** link = entry->bucket;
  while (*link != entry) {
    assert(*link != nullptr);
    link = &(*link)->next;
  }
  *link = entry->next;
  entry->table->num_entries--;
}

void FreeEntries(CU_HashTable* table, bool free_values) {
  for (uint32_t i = 0; i < table->allocated_buckets; ++i) {
    CU_HashEntry* entry = table->buckets[i];
    while (entry != nullptr) {
      CU_HashEntry* next = entry->next;
      if (free_values) std::free(entry->value);
      std::free(entry);
      entry = next;
    }
  }
}

// Counters stay stale on purpose; the table must be initialised again before
// reuse. Pointing at the cleared static heads with no walkable buckets makes
// a second delete, or an iteration of a deleted table, harmless.
void RetireTable(CU_HashTable* table) {
  if (table->buckets != table->static_buckets) std::free(table->buckets);
  table->buckets = table->static_buckets;
  for (CU_HashEntry*& head : table->static_buckets) head = nullptr;
  table->allocated_buckets = 0;
  table->find_proc = CU_BogusFind;
  table->create_proc = CU_BogusCreate;
}

uint32_t ChainLength(const CU_HashEntry* entry) {
  uint32_t length = 0;
  for (; entry != nullptr; entry = entry->next) ++length;
  return length;
}

struct ChainTally {
  int counts[kStatsCounters] = {};
  int overflow = 0;
  double average = 0.0;
};

// The average is not guarded against an empty table: it is then NaN.
ChainTally TallyChains(const CU_HashTable* table) {
  ChainTally tally;
  const uint32_t limit = WalkLimit(table);
  for (uint32_t i = 0; i < limit; ++i) {
    const uint32_t length = ChainLength(table->buckets[i]);
    if (length < kStatsCounters) {
      tally.counts[length]++;
    } else {
      tally.overflow++;
    }
    const double len = length;
    tally.average += (len + 1.0) * (len / table->num_entries) / 2.0;
  }
  return tally;
}

__attribute__((format(printf, 3, 4))) void AppendText(char* text, size_t* used, const char* format,
                                                      ...) {
  std::va_list args;
  va_start(args, format);
  const int written = std::vsnprintf(text + *used, kStatsTextSize - *used, format, args);
  va_end(args);
  if (written > 0) *used += static_cast<size_t>(written);
  if (*used >= kStatsTextSize) *used = kStatsTextSize - 1;
}

void WriteStats(char* text, const CU_HashTable* table, const ChainTally& tally) {
  size_t used = 0;
  text[0] = '\0';
  AppendText(text, &used, "%d entries in table, %d buckets\n", static_cast<int>(table->num_entries),
             static_cast<int>(table->num_buckets));
  for (int i = 0; i < kStatsCounters; ++i) {
    AppendText(text, &used, "number of buckets with %d entries: %d\n", i, tally.counts[i]);
  }
  AppendText(text, &used, "number of buckets with %d or more entries: %d\n", kStatsCounters,
             tally.overflow);
  AppendText(text, &used, "average search distance for entry: %.1f", tally.average);
}

}  // namespace

void* (*CU_BucketAlloc)(size_t size) = SystemAlloc;
void* (*CU_EntryAlloc)(size_t size) = SystemAlloc;

void CU_InitHashTable(CU_HashTable* table, int32_t key_type) {
  assert(key_type >= 0);
  table->buckets = table->static_buckets;
  for (CU_HashEntry*& head : table->static_buckets) head = nullptr;
  table->num_buckets = 4;
  table->num_entries = 0;
  table->rebuild_size = 12;
  table->down_shift = 28;
  table->mask = 3;
  table->key_type = key_type;
  table->find_proc = key_type == 0 ? CU_StringFind : CU_ArrayFind;
  table->create_proc = key_type == 0 ? CU_StringCreate : CU_ArrayCreate;
  table->allocated_buckets = 4;
}

CU_HashEntry* CU_StringFind(CU_HashTable* table, const void* key) {
  return FindInChain(table, IndexOf(table, key), key);
}

CU_HashEntry* CU_StringCreate(CU_HashTable* table, const void* key, int* is_new) {
  return FindOrCreate(table, key, is_new);
}

CU_HashEntry* CU_ArrayFind(CU_HashTable* table, const void* key) {
  return FindInChain(table, IndexOf(table, key), key);
}

CU_HashEntry* CU_ArrayCreate(CU_HashTable* table, const void* key, int* is_new) {
  return FindOrCreate(table, key, is_new);
}

CU_HashEntry* CU_BogusFind(CU_HashTable*, const void*) {
  return nullptr;
}

CU_HashEntry* CU_BogusCreate(CU_HashTable*, const void*, int*) {
  return nullptr;
}

void CU_DeleteHashEntry(CU_HashEntry* entry) {
  UnlinkEntry(entry);
  std::free(entry);
}

void CU_DeallocHashEntry(CU_HashEntry* entry) {
  std::free(entry->value);
  CU_DeleteHashEntry(entry);
}

void CU_DeleteHashTable(CU_HashTable* table) {
  FreeEntries(table, false);
  RetireTable(table);
}

void CU_DeallocHashTable(CU_HashTable* table) {
  FreeEntries(table, true);
  RetireTable(table);
}

CU_HashEntry* CU_FirstHashEntry(CU_HashTable* table, CU_HashSearch* search) {
  search->table = table;
  search->next_index = 0;
  search->next_entry = nullptr;
  return CU_NextHashEntry(search);
}

CU_HashEntry* CU_NextHashEntry(CU_HashSearch* search) {
  const CU_HashTable* table = search->table;
  while (search->next_entry == nullptr) {
    if (search->next_index >= WalkLimit(table)) return nullptr;
    search->next_entry = table->buckets[search->next_index++];
  }
  CU_HashEntry* entry = search->next_entry;
  search->next_entry = entry->next;
  return entry;
}

char* CU_HashStats(CU_HashTable* table) {
  const ChainTally tally = TallyChains(table);
  auto* text = static_cast<char*>(std::malloc(kStatsTextSize));
  if (text == nullptr) return nullptr;
  WriteStats(text, table, tally);
  return text;
}

// Each byte counts as a signed value: bytes 0x80..0xFF add -128..-1.
uint32_t CU_HashString(const char* text) {
  uint32_t hash = 0;
  for (const auto* byte = reinterpret_cast<const signed char*>(text); *byte != 0; ++byte) {
    hash += (hash << 3) + static_cast<uint32_t>(*byte);
  }
  return hash;
}

// On a failed allocation the table keeps its old array and mask, so lookups
// go on working; only num_buckets shows the multiplied count.
void CU_RebuildTable(CU_HashTable* table) {
  CU_HashEntry** old_buckets = table->buckets;
  const uint32_t old_count = table->allocated_buckets;
  table->num_buckets *= 4;
  CU_HashEntry** new_buckets = AllocBuckets(table->num_buckets, table->mask);
  if (new_buckets == nullptr) return;
  for (uint32_t i = 0; i < table->num_buckets; ++i) new_buckets[i] = nullptr;
  table->buckets = new_buckets;
  table->allocated_buckets = table->num_buckets;
  table->rebuild_size *= 4;
  table->down_shift -= 2;
  table->mask = table->mask * 4 + 3;
  MoveEntries(table, old_buckets, old_count);
  if (old_buckets != table->static_buckets) std::free(old_buckets);
}
