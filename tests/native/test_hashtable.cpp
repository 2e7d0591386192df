// Unit tests of the chained hash table: hashing and bucket indexes, find and
// create, growth (including failed growth), deletion while iterating, deleted
// tables, statistics text and value-freeing variants. Run under ASan/UBSan to
// catch leaks, double frees and out-of-array walks as failures.
#include "support/hashtable.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <map>
#include <set>
#include <string>
#include <vector>

namespace {

using AllocHook = void* (*)(size_t);

// Replaces an allocator hook with one that always fails, for its scope.
class ScopedAllocFailure {
 public:
  explicit ScopedAllocFailure(AllocHook* hook) : hook_(hook), saved_(*hook) {
    *hook_ = [](size_t) -> void* { return nullptr; };
  }
  ~ScopedAllocFailure() { *hook_ = saved_; }
  ScopedAllocFailure(const ScopedAllocFailure&) = delete;
  ScopedAllocFailure& operator=(const ScopedAllocFailure&) = delete;

 private:
  AllocHook* hook_;
  AllocHook saved_;
};

std::vector<std::string> NumberedKeys(int count) {
  std::vector<std::string> keys;
  for (int i = 0; i < count; ++i) keys.push_back("key-" + std::to_string(i));
  return keys;
}

std::vector<CU_HashEntry*> ChainOf(const CU_HashEntry* head) {
  std::vector<CU_HashEntry*> chain;
  for (auto* entry = const_cast<CU_HashEntry*>(head); entry != nullptr; entry = entry->next) {
    chain.push_back(entry);
  }
  return chain;
}

std::multiset<std::string> VisitedStringKeys(CU_HashTable* table) {
  std::multiset<std::string> keys;
  CU_HashSearch search;
  for (CU_HashEntry* entry = CU_FirstHashEntry(table, &search); entry != nullptr;
       entry = CU_NextHashEntry(&search)) {
    keys.insert(CU_GetHashKey(entry));
  }
  return keys;
}

uint64_t ArrayKeyOf(const CU_HashEntry* entry) {
  uint64_t key;
  std::memcpy(&key, CU_GetHashKey(entry), sizeof key);
  return key;
}

class StringTableTest : public ::testing::Test {
 protected:
  void SetUp() override { CU_InitHashTable(&table_, 0); }
  void TearDown() override { CU_DeleteHashTable(&table_); }

  CU_HashEntry* Create(const std::string& key, int* is_new = nullptr) {
    int local_is_new = -1;
    return CU_CreateHashEntry(&table_, key.c_str(), is_new ? is_new : &local_is_new);
  }
  CU_HashEntry* Find(const std::string& key) { return CU_FindHashEntry(&table_, key.c_str()); }
  void CreateAll(const std::vector<std::string>& keys) {
    for (const auto& key : keys) ASSERT_NE(Create(key), nullptr) << key;
  }
  void ExpectAllFindable(const std::vector<std::string>& keys) {
    for (const auto& key : keys) {
      CU_HashEntry* entry = Find(key);
      ASSERT_NE(entry, nullptr) << key;
      EXPECT_STREQ(CU_GetHashKey(entry), key.c_str());
      EXPECT_EQ(entry->table, &table_);
    }
  }
  CU_HashEntry** Bucket(uint32_t index) { return &table_.buckets[index]; }

  CU_HashTable table_;
};

class ArrayTableTest : public ::testing::Test {
 protected:
  void SetUp() override { CU_InitHashTable(&table_, 8); }
  void TearDown() override { CU_DeleteHashTable(&table_); }

  CU_HashEntry* Create(uint64_t key, int* is_new = nullptr) {
    int local_is_new = -1;
    return CU_CreateHashEntry(&table_, &key, is_new ? is_new : &local_is_new);
  }
  CU_HashEntry* CreateBytes(const unsigned char (&bytes)[8]) {
    int is_new = -1;
    return CU_CreateHashEntry(&table_, bytes, &is_new);
  }
  CU_HashEntry* Find(uint64_t key) { return CU_FindHashEntry(&table_, &key); }

  CU_HashTable table_;
};

// ---- String hash ----

TEST(HashStringTest, EmptyTextHashesToZero) {
  EXPECT_EQ(CU_HashString(""), 0u);
}

TEST(HashStringTest, KnownAsciiValues) {
  EXPECT_EQ(CU_HashString("a"), 97u);                    // 97
  EXPECT_EQ(CU_HashString("ab"), 971u);                  // 97*9 + 98
  EXPECT_EQ(CU_HashString("abc"), 8838u);                // 971*9 + 99
  EXPECT_EQ(CU_HashString("abcdefghijk"), 3028554754u);  // wraps modulo 2^32
}

TEST(HashStringTest, HighBytesCountAsNegative) {
  EXPECT_EQ(CU_HashString("\xFF"), 0xFFFFFFFFu);      // -1
  EXPECT_EQ(CU_HashString("\xFF\xFF"), 0xFFFFFFF6u);  // -1*9 - 1 = -10
  EXPECT_EQ(CU_HashString("\x80"), 0xFFFFFF80u);      // -128
  EXPECT_EQ(CU_HashString("a\xFF"), 872u);            // 97*9 - 1
}

// ---- Initialisation ----

TEST(InitHashTableTest, FreshStringTable) {
  CU_HashTable table;
  std::memset(&table, 0xAB, sizeof table);
  CU_InitHashTable(&table, 0);
  EXPECT_EQ(table.buckets, table.static_buckets);
  for (CU_HashEntry* head : table.static_buckets) EXPECT_EQ(head, nullptr);
  EXPECT_EQ(table.num_buckets, 4u);
  EXPECT_EQ(table.num_entries, 0u);
  EXPECT_EQ(table.rebuild_size, 12u);
  EXPECT_EQ(table.down_shift, 28);
  EXPECT_EQ(table.mask, 3u);
  EXPECT_EQ(table.key_type, 0);
  EXPECT_EQ(table.find_proc, &CU_StringFind);
  EXPECT_EQ(table.create_proc, &CU_StringCreate);
  CU_DeleteHashTable(&table);
}

TEST(InitHashTableTest, NonZeroKeyTypeChoosesArrayProcs) {
  for (int32_t key_type : {1, 4, 8, 16}) {
    CU_HashTable table;
    CU_InitHashTable(&table, key_type);
    EXPECT_EQ(table.key_type, key_type);
    EXPECT_EQ(table.find_proc, &CU_ArrayFind);
    EXPECT_EQ(table.create_proc, &CU_ArrayCreate);
    CU_DeleteHashTable(&table);
  }
}

// ---- String keys ----

TEST_F(StringTableTest, EmptyKeyIsValidAndLivesInBucketZero) {
  int is_new = -1;
  CU_HashEntry* entry = Create("", &is_new);
  ASSERT_NE(entry, nullptr);
  EXPECT_EQ(is_new, 1);
  EXPECT_EQ(entry->bucket, Bucket(0));
  EXPECT_STREQ(CU_GetHashKey(entry), "");
  EXPECT_EQ(Find(""), entry);
  EXPECT_EQ(Find("a"), nullptr);
}

TEST_F(StringTableTest, BucketIsLowBitsOfHash) {
  // 'a' 97, 'b' 98, 'c' 99, 'd' 100: low two bits 1, 2, 3, 0.
  EXPECT_EQ(Create("a")->bucket, Bucket(1));
  EXPECT_EQ(Create("b")->bucket, Bucket(2));
  EXPECT_EQ(Create("c")->bucket, Bucket(3));
  EXPECT_EQ(Create("d")->bucket, Bucket(0));
  EXPECT_EQ(Create("\xFF")->bucket, Bucket(3));
}

TEST_F(StringTableTest, NewEntryHasNullValueAndCountsOnce) {
  int is_new = -1;
  CU_HashEntry* entry = Create("module.py", &is_new);
  ASSERT_NE(entry, nullptr);
  EXPECT_EQ(is_new, 1);
  EXPECT_EQ(CU_GetHashValue(entry), nullptr);
  EXPECT_EQ(entry->table, &table_);
  EXPECT_EQ(table_.num_entries, 1u);
}

TEST_F(StringTableTest, CreateCopiesTheKey) {
  char key[] = "transient";
  int is_new = -1;
  CU_HashEntry* entry = CU_CreateHashEntry(&table_, key, &is_new);
  ASSERT_NE(entry, nullptr);
  EXPECT_NE(CU_GetHashKey(entry), key);
  std::memset(key, 'x', sizeof key - 1);
  EXPECT_EQ(Find("transient"), entry);
  EXPECT_EQ(Find("xxxxxxxxx"), nullptr);
}

TEST_F(StringTableTest, CreateExistingKeyReturnsSameEntryAndKeepsValue) {
  int value = 7;
  CU_HashEntry* first = Create("same");
  ASSERT_NE(first, nullptr);
  CU_SetHashValue(first, &value);
  int is_new = -1;
  CU_HashEntry* again = Create("same", &is_new);
  EXPECT_EQ(again, first);
  EXPECT_EQ(is_new, 0);
  EXPECT_EQ(CU_GetHashValue(again), &value);
  EXPECT_EQ(table_.num_entries, 1u);
}

TEST_F(StringTableTest, MatchesWholeKeyIncludingTerminator) {
  ASSERT_NE(Create("abc"), nullptr);
  EXPECT_NE(Find("abc"), nullptr);
  EXPECT_EQ(Find("ab"), nullptr);
  EXPECT_EQ(Find("abcd"), nullptr);
  EXPECT_EQ(Find("abC"), nullptr);
}

TEST_F(StringTableTest, KeysSharingABucketAreKeptApart) {
  // "a" (97) and "e" (101) both land in bucket 1; the later one heads the chain.
  CU_HashEntry* a = Create("a");
  CU_HashEntry* e = Create("e");
  ASSERT_NE(a, nullptr);
  ASSERT_NE(e, nullptr);
  EXPECT_NE(a, e);
  EXPECT_EQ(ChainOf(*Bucket(1)), (std::vector<CU_HashEntry*>{e, a}));
  EXPECT_EQ(Find("a"), a);
  EXPECT_EQ(Find("e"), e);
}

// ---- Growth ----

TEST_F(StringTableTest, TwelfthEntryGrowsToSixteenBuckets) {
  const auto keys = NumberedKeys(12);
  CreateAll({keys.begin(), keys.begin() + 11});
  EXPECT_EQ(table_.num_buckets, 4u);
  EXPECT_EQ(table_.buckets, table_.static_buckets);
  ASSERT_NE(Create(keys[11]), nullptr);
  EXPECT_EQ(table_.num_entries, 12u);
  EXPECT_EQ(table_.num_buckets, 16u);
  EXPECT_EQ(table_.rebuild_size, 48u);
  EXPECT_EQ(table_.down_shift, 26);
  EXPECT_EQ(table_.mask, 15u);
  EXPECT_NE(table_.buckets, table_.static_buckets);
  ExpectAllFindable(keys);
}

TEST_F(StringTableTest, FortyEighthEntryGrowsToSixtyFourBuckets) {
  const auto keys = NumberedKeys(48);
  CreateAll({keys.begin(), keys.begin() + 47});
  EXPECT_EQ(table_.num_buckets, 16u);
  ASSERT_NE(Create(keys[47]), nullptr);
  EXPECT_EQ(table_.num_buckets, 64u);
  EXPECT_EQ(table_.rebuild_size, 192u);
  EXPECT_EQ(table_.down_shift, 24);
  EXPECT_EQ(table_.mask, 63u);
  ExpectAllFindable(keys);
}

TEST_F(StringTableTest, EntriesAreRehashedIntoTheirNewBuckets) {
  const auto keys = NumberedKeys(300);
  CreateAll(keys);
  EXPECT_EQ(table_.num_buckets, 256u);
  ExpectAllFindable(keys);
  for (const auto& key : keys) {
    const uint32_t index = CU_HashString(key.c_str()) & table_.mask;
    EXPECT_EQ(Find(key)->bucket, Bucket(index)) << key;
  }
}

TEST_F(StringTableTest, DeletionsDoNotShrinkTheTable) {
  const auto keys = NumberedKeys(12);
  CreateAll(keys);
  for (const auto& key : keys) CU_DeleteHashEntry(Find(key));
  EXPECT_EQ(table_.num_entries, 0u);
  EXPECT_EQ(table_.num_buckets, 16u);
  EXPECT_EQ(table_.mask, 15u);
}

// ---- Array keys ----

TEST_F(ArrayTableTest, IndexFollowsTheByteSum) {
  // sum 0 -> product 0 -> bucket 0.
  EXPECT_EQ(CreateBytes({0, 0, 0, 0, 0, 0, 0, 0})->bucket, &table_.buckets[0]);
  // sum 10 -> 0x91BF1042, arithmetic >> 28 = 0xFFFFFFF9, & 3 = 1.
  EXPECT_EQ(CreateBytes({10, 0, 0, 0, 0, 0, 0, 0})->bucket, &table_.buckets[1]);
  // sum -1 (byte 0xFF) -> 0xBE39B193, >> 28 = 0xFFFFFFFB, & 3 = 3.
  EXPECT_EQ(CreateBytes({0, 0, 0, 0xFF, 0, 0, 0, 0})->bucket, &table_.buckets[3]);
}

TEST_F(ArrayTableTest, IndexUsesTheGrownShiftAndMask) {
  for (uint64_t key = 100; key < 112; ++key) ASSERT_NE(Create(key), nullptr);
  ASSERT_EQ(table_.num_buckets, 16u);
  // sum 10 -> 0x91BF1042, arithmetic >> 26 = ...11100100, & 15 = 4.
  EXPECT_EQ(CreateBytes({0, 10, 0, 0, 0, 0, 0, 0})->bucket, &table_.buckets[4]);
  // sum 3 -> 0xC552EB47, arithmetic >> 26 = ...11110001, & 15 = 1.
  EXPECT_EQ(CreateBytes({1, 1, 1, 0, 0, 0, 0, 0})->bucket, &table_.buckets[1]);
  // Entries moved by the growth sit where the new rule puts them:
  // sum 100 -> 0xB176A294, >> 26 = ...101100, & 15 = 12;
  // sum 111 -> 0x84FC0143, >> 26 = ...100001, & 15 = 1.
  EXPECT_EQ(Find(100)->bucket, &table_.buckets[12]);
  EXPECT_EQ(Find(111)->bucket, &table_.buckets[1]);
}

TEST_F(ArrayTableTest, PermutedKeysShareABucketButStayDistinct) {
  CU_HashEntry* first = CreateBytes({1, 2, 3, 0, 0, 0, 0, 0});
  CU_HashEntry* second = CreateBytes({3, 2, 1, 0, 0, 0, 0, 0});
  CU_HashEntry* third = CreateBytes({0, 0, 0, 0, 0, 1, 2, 3});
  ASSERT_NE(first, nullptr);
  ASSERT_NE(second, nullptr);
  ASSERT_NE(third, nullptr);
  EXPECT_EQ(first->bucket, second->bucket);
  EXPECT_EQ(first->bucket, third->bucket);
  EXPECT_EQ(ChainOf(*first->bucket), (std::vector<CU_HashEntry*>{third, second, first}));
  EXPECT_EQ(table_.num_entries, 3u);
}

TEST_F(ArrayTableTest, ComparesEveryKeyByte) {
  CU_HashEntry* entry = Create(0x0100000000000000u);
  ASSERT_NE(entry, nullptr);
  EXPECT_EQ(Find(0x0100000000000000u), entry);
  EXPECT_EQ(Find(0x0000000000000001u), nullptr);  // same byte sum, other order
  EXPECT_EQ(Find(0x0200000000000000u), nullptr);
}

TEST_F(ArrayTableTest, CreateExistingKeyReturnsSameEntry) {
  int value = 1;
  CU_HashEntry* first = Create(42);
  CU_SetHashValue(first, &value);
  int is_new = -1;
  EXPECT_EQ(Create(42, &is_new), first);
  EXPECT_EQ(is_new, 0);
  EXPECT_EQ(CU_GetHashValue(first), &value);
}

TEST_F(ArrayTableTest, PointerKeysFindableAfterGrowth) {
  std::vector<int> words(200);
  std::vector<uint64_t> keys;
  for (auto& word : words) keys.push_back(reinterpret_cast<uintptr_t>(&word));
  for (uint64_t i = 0; i < 100; ++i) keys.push_back(i * 0x9E3779B97F4A7C15u);
  for (uint64_t key : keys) ASSERT_NE(Create(key), nullptr);
  EXPECT_EQ(table_.num_entries, keys.size());
  EXPECT_EQ(table_.num_buckets, 256u);
  EXPECT_EQ(table_.down_shift, 22);
  for (uint64_t key : keys) {
    CU_HashEntry* entry = Find(key);
    ASSERT_NE(entry, nullptr) << key;
    EXPECT_EQ(ArrayKeyOf(entry), key);
  }
}

// ---- Entry deletion ----

TEST_F(ArrayTableTest, DeleteMiddleOfChain) {
  CU_HashEntry* first = CreateBytes({4, 5, 0, 0, 0, 0, 0, 0});
  CU_HashEntry* middle = CreateBytes({5, 4, 0, 0, 0, 0, 0, 0});
  CU_HashEntry* head = CreateBytes({0, 0, 0, 0, 0, 0, 4, 5});
  CU_HashEntry** bucket = first->bucket;
  ASSERT_EQ(ChainOf(*bucket), (std::vector<CU_HashEntry*>{head, middle, first}));
  int value = 3;
  CU_SetHashValue(middle, &value);  // not owned: deletion must not free it
  CU_DeleteHashEntry(middle);
  EXPECT_EQ(ChainOf(*bucket), (std::vector<CU_HashEntry*>{head, first}));
  EXPECT_EQ(table_.num_entries, 2u);
  const unsigned char deleted[8] = {5, 4, 0, 0, 0, 0, 0, 0};
  EXPECT_EQ(CU_FindHashEntry(&table_, deleted), nullptr);
  EXPECT_EQ(value, 3);
}

TEST_F(StringTableTest, DeleteHeadAndTailOfChain) {
  CU_HashEntry* tail = Create("a");
  CU_HashEntry* middle = Create("e");
  CU_HashEntry* head = Create("i");  // 105: bucket 1 as well
  CU_DeleteHashEntry(head);
  EXPECT_EQ(*Bucket(1), middle);
  CU_DeleteHashEntry(tail);
  EXPECT_EQ(ChainOf(*Bucket(1)), (std::vector<CU_HashEntry*>{middle}));
  EXPECT_EQ(table_.num_entries, 1u);
  EXPECT_EQ(Find("a"), nullptr);
  EXPECT_EQ(Find("e"), middle);
  EXPECT_EQ(Find("i"), nullptr);
}

TEST_F(StringTableTest, DeallocEntryFreesItsValue) {
  CU_HashEntry* owned = Create("owned");
  CU_SetHashValue(owned, std::malloc(32));
  CU_DeallocHashEntry(owned);  // a leak here fails the leak-checking run
  CU_HashEntry* empty = Create("empty");
  CU_DeallocHashEntry(empty);  // null value: nothing to free
  EXPECT_EQ(table_.num_entries, 0u);
  EXPECT_EQ(Find("owned"), nullptr);
}

// ---- Iteration ----

TEST_F(StringTableTest, IterationOfEmptyTableYieldsNothing) {
  CU_HashSearch search;
  EXPECT_EQ(CU_FirstHashEntry(&table_, &search), nullptr);
  EXPECT_EQ(CU_NextHashEntry(&search), nullptr);
}

TEST_F(StringTableTest, IterationVisitsEveryEntryOnce) {
  const auto keys = NumberedKeys(100);
  CreateAll(keys);
  EXPECT_EQ(VisitedStringKeys(&table_), std::multiset<std::string>(keys.begin(), keys.end()));
}

TEST_F(StringTableTest, IterationFollowsBucketOrderThenChainOrder) {
  CU_HashEntry* a = Create("a");  // bucket 1
  CU_HashEntry* d = Create("d");  // bucket 0
  CU_HashEntry* e = Create("e");  // bucket 1, ahead of "a"
  CU_HashSearch search;
  EXPECT_EQ(CU_FirstHashEntry(&table_, &search), d);
  EXPECT_EQ(CU_NextHashEntry(&search), e);
  EXPECT_EQ(CU_NextHashEntry(&search), a);
  EXPECT_EQ(CU_NextHashEntry(&search), nullptr);
}

TEST_F(StringTableTest, ExhaustedCursorKeepsReturningNull) {
  CreateAll({"x", "y"});
  CU_HashSearch search;
  ASSERT_NE(CU_FirstHashEntry(&table_, &search), nullptr);
  ASSERT_NE(CU_NextHashEntry(&search), nullptr);
  for (int i = 0; i < 5; ++i) EXPECT_EQ(CU_NextHashEntry(&search), nullptr);
  EXPECT_EQ(search.next_index, table_.num_buckets);
}

TEST_F(StringTableTest, DeletingLastReturnedEntryLetsIterationContinue) {
  const auto keys = NumberedKeys(40);  // grown table with shared chains
  CreateAll(keys);
  std::multiset<std::string> visited;
  CU_HashSearch search;
  CU_HashEntry* entry = CU_FirstHashEntry(&table_, &search);
  while (entry != nullptr) {
    visited.insert(CU_GetHashKey(entry));
    CU_DeleteHashEntry(entry);
    entry = CU_NextHashEntry(&search);
  }
  EXPECT_EQ(visited, std::multiset<std::string>(keys.begin(), keys.end()));
  EXPECT_EQ(table_.num_entries, 0u);
  for (const auto& key : keys) EXPECT_EQ(Find(key), nullptr);
  EXPECT_EQ(CU_FirstHashEntry(&table_, &search), nullptr);
}

TEST_F(ArrayTableTest, FetchNextThenDeletePreviousClearsTable) {
  for (uint64_t key = 0; key < 30; ++key) ASSERT_NE(Create(key * 3), nullptr);
  std::multiset<uint64_t> visited;
  CU_HashSearch search;
  CU_HashEntry* entry = CU_FirstHashEntry(&table_, &search);
  while (entry != nullptr) {
    CU_HashEntry* next = CU_NextHashEntry(&search);
    visited.insert(ArrayKeyOf(entry));
    CU_DeleteHashEntry(entry);
    entry = next;
  }
  EXPECT_EQ(visited.size(), 30u);
  for (uint64_t key = 0; key < 30; ++key) EXPECT_EQ(visited.count(key * 3), 1u) << key;
  EXPECT_EQ(table_.num_entries, 0u);
}

// ---- Deleted tables ----

TEST(DeletedTableTest, FindAndCreateAnswerNullForEveryKey) {
  CU_HashTable table;
  CU_InitHashTable(&table, 0);
  const auto keys = NumberedKeys(20);
  int is_new = -1;
  for (const auto& key : keys) ASSERT_NE(CU_CreateHashEntry(&table, key.c_str(), &is_new), nullptr);
  CU_DeleteHashTable(&table);
  EXPECT_EQ(table.find_proc, &CU_BogusFind);
  EXPECT_EQ(table.create_proc, &CU_BogusCreate);
  EXPECT_EQ(table.num_entries, 20u);  // counters are left stale
  EXPECT_EQ(table.num_buckets, 16u);
  for (const auto& key : keys) {
    EXPECT_EQ(CU_FindHashEntry(&table, key.c_str()), nullptr);
    is_new = 42;
    EXPECT_EQ(CU_CreateHashEntry(&table, key.c_str(), &is_new), nullptr);
    EXPECT_EQ(is_new, 42);
  }
  EXPECT_EQ(CU_FindHashEntry(&table, "never-added"), nullptr);
}

TEST(DeletedTableTest, BogusProcsIgnoreTheirArguments) {
  int is_new = 9;
  EXPECT_EQ(CU_BogusFind(nullptr, "k"), nullptr);
  EXPECT_EQ(CU_BogusCreate(nullptr, "k", &is_new), nullptr);
  EXPECT_EQ(is_new, 9);
}

TEST(DeletedTableTest, DeleteLeavesValuesAlone) {
  CU_HashTable table;
  CU_InitHashTable(&table, 0);
  int values[3] = {1, 2, 3};  // on the stack: freeing them would be caught
  int is_new = -1;
  for (int& value : values) {
    const std::string key = std::to_string(value);
    CU_SetHashValue(CU_CreateHashEntry(&table, key.c_str(), &is_new), &value);
  }
  CU_DeleteHashTable(&table);
  EXPECT_EQ(values[0] + values[1] + values[2], 6);
}

TEST(DeletedTableTest, ReinitialisedTableWorksAgain) {
  for (int32_t key_type : {0, 8}) {
    CU_HashTable table;
    CU_InitHashTable(&table, key_type);
    int is_new = -1;
    const char key[16] = "sixteen-bytes!!";
    for (int round = 0; round < 3; ++round) {
      CU_HashEntry* entry = CU_CreateHashEntry(&table, key, &is_new);
      ASSERT_NE(entry, nullptr);
      EXPECT_EQ(is_new, 1);
      EXPECT_EQ(CU_FindHashEntry(&table, key), entry);
      CU_DeleteHashTable(&table);
      EXPECT_EQ(CU_FindHashEntry(&table, key), nullptr);
      CU_InitHashTable(&table, key_type);
      EXPECT_EQ(table.num_entries, 0u);
      EXPECT_EQ(CU_FindHashEntry(&table, key), nullptr);
    }
    CU_DeleteHashTable(&table);
  }
}

TEST(DeletedTableTest, DeletingTwiceAndIteratingAreHarmless) {
  CU_HashTable table;
  CU_InitHashTable(&table, 0);
  int is_new = -1;
  for (const auto& key : NumberedKeys(20)) CU_CreateHashEntry(&table, key.c_str(), &is_new);
  CU_DeleteHashTable(&table);
  CU_HashSearch search;
  EXPECT_EQ(CU_FirstHashEntry(&table, &search), nullptr);
  CU_DeleteHashTable(&table);
  EXPECT_EQ(CU_FindHashEntry(&table, "key-1"), nullptr);
}

TEST(DeallocTableTest, FreesEveryValue) {
  CU_HashTable table;
  CU_InitHashTable(&table, 8);
  int is_new = -1;
  for (uint64_t key = 0; key < 50; ++key) {
    CU_HashEntry* entry = CU_CreateHashEntry(&table, &key, &is_new);
    ASSERT_NE(entry, nullptr);
    if (key % 5 != 0) CU_SetHashValue(entry, std::malloc(16));  // some stay null
  }
  CU_DeallocHashTable(&table);  // a leak here fails the leak-checking run
  EXPECT_EQ(table.find_proc, &CU_BogusFind);
  const uint64_t key = 1;
  EXPECT_EQ(CU_FindHashEntry(&table, &key), nullptr);
}

// ---- Allocation failure ----

TEST_F(StringTableTest, FailedEntryAllocationLeavesTableUnchanged) {
  CreateAll(NumberedKeys(11));
  const auto before = VisitedStringKeys(&table_);
  {
    ScopedAllocFailure failure(&CU_EntryAlloc);
    int is_new = -1;
    EXPECT_EQ(Create("twelfth", &is_new), nullptr);
    EXPECT_EQ(is_new, 1);
  }
  EXPECT_EQ(table_.num_entries, 11u);
  EXPECT_EQ(table_.num_buckets, 4u);  // no growth either
  EXPECT_EQ(Find("twelfth"), nullptr);
  EXPECT_EQ(VisitedStringKeys(&table_), before);
  int is_new = -1;
  EXPECT_NE(Create("twelfth", &is_new), nullptr);
  EXPECT_EQ(is_new, 1);
  EXPECT_EQ(table_.num_buckets, 16u);
}

TEST_F(StringTableTest, FailedGrowthKeepsOldArrayAndInflatesCount) {
  const auto keys = NumberedKeys(12);
  {
    ScopedAllocFailure failure(&CU_BucketAlloc);
    CreateAll(keys);
  }
  EXPECT_EQ(table_.num_entries, 12u);
  EXPECT_EQ(table_.num_buckets, 16u);
  EXPECT_EQ(table_.buckets, table_.static_buckets);
  EXPECT_EQ(table_.rebuild_size, 12u);
  EXPECT_EQ(table_.down_shift, 28);
  EXPECT_EQ(table_.mask, 3u);
  ExpectAllFindable(keys);
  for (const auto& key : keys) {
    const uint32_t index = CU_HashString(key.c_str()) & 3u;
    EXPECT_EQ(Find(key)->bucket, Bucket(index));
  }
}

TEST_F(StringTableTest, TableStaysSafeAfterFailedGrowth) {
  const auto keys = NumberedKeys(14);
  {
    ScopedAllocFailure failure(&CU_BucketAlloc);
    CreateAll({keys.begin(), keys.begin() + 13});  // 12th and 13th fail to grow
  }
  EXPECT_EQ(table_.num_buckets, 64u);
  EXPECT_EQ(table_.buckets, table_.static_buckets);
  EXPECT_EQ(VisitedStringKeys(&table_),
            std::multiset<std::string>(keys.begin(), keys.begin() + 13));
  char* stats = CU_HashStats(&table_);
  ASSERT_NE(stats, nullptr);
  EXPECT_EQ(std::string(stats).rfind("13 entries in table, 64 buckets\n", 0), 0u) << stats;
  std::free(stats);
  CU_DeleteHashEntry(Find(keys[0]));
  EXPECT_EQ(Find(keys[0]), nullptr);
  EXPECT_EQ(table_.num_entries, 12u);
  // The allocator works again: re-adding makes 13 entries and grows for real.
  ASSERT_NE(Create(keys[0]), nullptr);
  EXPECT_EQ(table_.num_buckets, 256u);
  EXPECT_NE(table_.buckets, table_.static_buckets);
  ASSERT_NE(Create(keys[13]), nullptr);
  EXPECT_EQ(table_.rebuild_size, 48u);
  EXPECT_EQ(table_.down_shift, 26);
  EXPECT_EQ(table_.mask, 15u);
  ExpectAllFindable(keys);
  EXPECT_EQ(VisitedStringKeys(&table_), std::multiset<std::string>(keys.begin(), keys.end()));
}

TEST_F(ArrayTableTest, RepeatedFailedGrowthStaysUsable) {
  {
    ScopedAllocFailure failure(&CU_BucketAlloc);
    for (uint64_t key = 0; key < 40; ++key) ASSERT_NE(Create(key), nullptr);
  }
  EXPECT_EQ(table_.mask, 3u);
  EXPECT_EQ(table_.buckets, table_.static_buckets);
  for (uint64_t key = 40; key < 60; ++key) ASSERT_NE(Create(key), nullptr);
  for (uint64_t key = 0; key < 60; ++key) EXPECT_NE(Find(key), nullptr) << key;
  char* stats = CU_HashStats(&table_);
  ASSERT_NE(stats, nullptr);
  std::free(stats);
  CU_HashSearch search;
  for (CU_HashEntry* entry = CU_FirstHashEntry(&table_, &search); entry != nullptr;
       entry = CU_NextHashEntry(&search)) {
    EXPECT_LT(ArrayKeyOf(entry), 60u);
  }
}

// ---- Statistics ----

std::string StatsText(CU_HashTable* table) {
  char* text = CU_HashStats(table);
  EXPECT_NE(text, nullptr);
  std::string copy = text ? text : "";
  std::free(text);
  return copy;
}

std::string CounterLines(const std::map<int, int>& nonzero) {
  std::string lines;
  for (int i = 0; i < 10; ++i) {
    const auto it = nonzero.find(i);
    lines += "number of buckets with " + std::to_string(i) +
             " entries: " + std::to_string(it == nonzero.end() ? 0 : it->second) + "\n";
  }
  return lines;
}

TEST_F(StringTableTest, StatsOfSmallKnownTable) {
  CreateAll({"a", "b", "e"});  // buckets 0..3 hold 0, 2, 1, 0 entries
  // average: 3 * (2/3) / 2 + 2 * (1/3) / 2 = 1.333...
  const std::string expected = "3 entries in table, 4 buckets\n" +
                               CounterLines({{0, 2}, {1, 1}, {2, 1}}) +
                               "number of buckets with 10 or more entries: 0\n"
                               "average search distance for entry: 1.3";
  EXPECT_EQ(StatsText(&table_), expected);
}

TEST_F(StringTableTest, StatsCountLongChainsAsOverflow) {
  // All these bytes are multiples of 4, so the eleven keys share bucket 0.
  CreateAll({"0", "4", "8", "<", "@", "D", "H", "L", "P", "T", "X"});
  ASSERT_EQ(ChainOf(*Bucket(0)).size(), 11u);
  const std::string expected = "11 entries in table, 4 buckets\n" + CounterLines({{0, 3}}) +
                               "number of buckets with 10 or more entries: 1\n"
                               "average search distance for entry: 6.0";
  EXPECT_EQ(StatsText(&table_), expected);
}

TEST_F(StringTableTest, StatsOfEmptyTableHasNaNAverage) {
  const std::string text = StatsText(&table_);
  const std::string head = "0 entries in table, 4 buckets\n" + CounterLines({{0, 4}}) +
                           "number of buckets with 10 or more entries: 0\n"
                           "average search distance for entry: ";
  ASSERT_EQ(text.substr(0, head.size()), head);
  const std::string average = text.substr(head.size());
  EXPECT_TRUE(average == "nan" || average == "-nan") << average;
}

TEST_F(StringTableTest, StatsTextFitsItsBuffer) {
  CreateAll(NumberedKeys(1000));
  const std::string text = StatsText(&table_);
  EXPECT_LT(text.size(), 900u);
  EXPECT_EQ(text.rfind("1000 entries in table, 1024 buckets\n", 0), 0u) << text;
}

}  // namespace
