#include "mon/hash_table.h"

#include <errno.h>
#include <gtest/gtest.h>

#include <array>
#include <set>
#include <string>
#include <vector>

namespace {

struct Entry {
    int before = 0;  // so that the link is not at the record's start
    HashLink link = {};
    std::string name{};
};

constexpr size_t POSITION = offsetof(Entry, link);

// A table of entries under their names, one byte or more each.
class Names {
  public:
    explicit Names(uint32_t size_hint) : table_(hash_create(size_hint)) {}
    ~Names() { hash_destroy(table_); }
    HashTable *table() { return table_; }
    void insert(Entry &entry) {
        EXPECT_EQ(0, hash_insert(table_, entry.name.data(),
                                 static_cast<uint32_t>(entry.name.size()), &entry.link));
    }
    Entry *find(const std::string &name) {
        return static_cast<Entry *>(hash_find(table_, name.c_str(), 0, POSITION));
    }
    Entry *next(HashCursor *cursor) {
        return static_cast<Entry *>(hash_next(table_, cursor, nullptr, nullptr, POSITION));
    }
    // The names in the order of an iteration.
    std::string all() {
        std::string names;
        HashCursor cursor = {};
        while (Entry *entry = next(&cursor))
            names += entry->name + " ";
        return names;
    }

  private:
    HashTable *table_;
};

uint32_t buckets_for(uint32_t hint) {
    HashTable *table = hash_create(hint);
    if (table == nullptr)
        return 0;
    uint32_t count = table->bucket_count;
    hash_destroy(table);
    return count;
}

uint32_t hash_of(const std::string &key) {
    return hash_key(key.data(), static_cast<uint32_t>(key.size()));
}

TEST(HashCreate, Of0AndOf8BothGives16BucketsAndOf16Gives32) {
    EXPECT_EQ(16u, buckets_for(0));
    EXPECT_EQ(16u, buckets_for(8));
    EXPECT_EQ(32u, buckets_for(16));
}

TEST(HashCreate, TakesTheSmallestPowerOfTwoGreaterThanTheHint) {
    EXPECT_EQ(2u, buckets_for(1));
    EXPECT_EQ(4u, buckets_for(2));
    EXPECT_EQ(4u, buckets_for(3));
    EXPECT_EQ(8u, buckets_for(7));
    EXPECT_EQ(16u, buckets_for(15));
    EXPECT_EQ(512u, buckets_for(511));
    EXPECT_EQ(1024u, buckets_for(512));
}

TEST(HashCreate, RefusesATableThatCannotBeCounted) {
    EXPECT_EQ(0u, buckets_for(0x80000000u));
    EXPECT_EQ(0u, buckets_for(0xffffffffu));
}

TEST(HashCreate, GivesAnEmptyTableWithOneSpareSlotBehindTheBuckets) {
    HashTable *table = hash_create(1);
    EXPECT_EQ(0u, table->count);
    HashLink *const *slots = table->buckets;
    for (size_t i = 0; i <= 2; ++i)
        EXPECT_EQ(nullptr, slots[i]);
    hash_destroy(table);
}

TEST(HashTable, KeepsItsFieldsInTheirOrder) {
    EXPECT_EQ(0u, offsetof(HashTable, count));
    EXPECT_EQ(4u, offsetof(HashTable, bucket_count));
    EXPECT_EQ(8u, offsetof(HashTable, buckets));
    EXPECT_LT(offsetof(HashLink, next), offsetof(HashLink, key));
    EXPECT_LT(offsetof(HashLink, key), offsetof(HashLink, key_length));
}

TEST(HashKey, GivesTheValuesComputedByHand) {
    EXPECT_EQ(97u, hash_of("a"));
    EXPECT_EQ(6363201u, hash_of("ab"));  // 97 * 65599 + 98
    EXPECT_EQ(0x3025f862u, hash_of("abc"));
    EXPECT_EQ(0x99a6371cu, hash_of("fieldkit"));
    EXPECT_EQ(0x2e86d0bfu, hash_of({1, 0, 0, 0}));
    EXPECT_EQ(0x2ba75b9bu, hash_of({'\xe8', 3, 0, 0}));
}

TEST(HashKey, TakesBytesAsUnsigned) {
    EXPECT_EQ(255u, hash_of("\xff"));
    EXPECT_EQ(0xd6da9f80u, hash_of("\xff\xff\xff\xff"));
}

TEST(HashKey, OfNoBytesIs0) {
    EXPECT_EQ(0u, hash_key("x", 0));
    EXPECT_EQ(0u, hash_key(nullptr, 0));
}

TEST(HashTable, PutsARecordIntoTheBucketOfTheLowBitsOfItsHash) {
    Names names(8);
    Entry a{.name = "a"};
    Entry abc{.name = "abc"};
    names.insert(a);
    names.insert(abc);
    EXPECT_EQ(&a.link, names.table()->buckets[97 % 16]);
    EXPECT_EQ(&abc.link, names.table()->buckets[2]);
    EXPECT_EQ(2u, names.table()->count);
}

TEST(HashTable, KeepsACopyOfTheKey) {
    Names names(0);
    Entry entry;
    char key[] = "key";
    ASSERT_EQ(0, hash_insert(names.table(), key, 0, &entry.link));
    EXPECT_EQ(3u, entry.link.key_length);
    EXPECT_EQ("key", std::string(static_cast<char *>(entry.link.key), 3));
    key[0] = 'K';
    EXPECT_EQ(&entry, names.find("key"));
    EXPECT_EQ(nullptr, names.find("Key"));
}

TEST(HashTable, FindsNothingInAnEmptyTable) {
    Names names(0);
    EXPECT_EQ(nullptr, names.find("a"));
    EXPECT_EQ("", names.all());
}

TEST(HashTable, TellsCollidingKeysApart) {
    Names names(8);
    // 'a' and 'q' differ by 16.
    Entry a{.name = "a"};
    Entry q{.name = "q"};
    names.insert(a);
    names.insert(q);
    EXPECT_EQ(&a, names.find("a"));
    EXPECT_EQ(&q, names.find("q"));
    EXPECT_EQ(nullptr, names.find("1"));  // of the same bucket
    EXPECT_EQ("q a ", names.all()) << "the last one first";
}

TEST(HashTable, TellsKeysOfTheSameHashAndOtherLengthsApart) {
    Names names(8);
    Entry zero{.name = std::string(1, '\0')};
    Entry zeros{.name = std::string(2, '\0')};
    names.insert(zero);
    names.insert(zeros);
    EXPECT_EQ(&zero, hash_find(names.table(), "\0\0", 1, POSITION));
    EXPECT_EQ(&zeros, hash_find(names.table(), "\0\0", 2, POSITION));
    EXPECT_EQ(nullptr, hash_find(names.table(), "\0\0\0", 3, POSITION));
}

TEST(HashTable, HoldsAKeyOfLength0) {
    Names names(8);
    Entry empty;
    Entry zero{.name = std::string(1, '\0')};
    ASSERT_EQ(0, hash_insert(names.table(), "", 0, &empty.link));
    names.insert(zero);
    EXPECT_EQ(0u, empty.link.key_length);
    EXPECT_EQ(&empty, names.find(""));
    EXPECT_EQ(0, hash_remove(names.table(), &empty.link));
    EXPECT_EQ(nullptr, names.find(""));
    EXPECT_EQ(&zero, hash_find(names.table(), "", 1, POSITION));
}

TEST(HashTable, TakesTheSameKeyTwiceAndFindsTheLastOne) {
    Names names(8);
    Entry first{.name = "a"};
    Entry second{.name = "a"};
    names.insert(first);
    names.insert(second);
    EXPECT_EQ(2u, names.table()->count);
    EXPECT_EQ(&second, names.find("a"));
    EXPECT_EQ(0, hash_remove(names.table(), &second.link));
    EXPECT_EQ(&first, names.find("a"));
}

TEST(HashTable, RemovesFromTheHeadTheMiddleAndTheEndOfABucket) {
    for (size_t removed = 0; removed < 3; ++removed) {
        Names names(8);
        std::array<Entry, 3> entries = {Entry{.name = "a"}, {.name = "q"}, {.name = "1"}};
        for (Entry &entry : entries)
            names.insert(entry);
        EXPECT_EQ(0, hash_remove(names.table(), &entries[removed].link));
        EXPECT_EQ(2u, names.table()->count);
        for (size_t i = 0; i < 3; ++i)
            EXPECT_EQ(i == removed ? nullptr : &entries[i], names.find(entries[i].name));
    }
}

TEST(HashTable, DoesNotRemoveWhatIsNotInIt) {
    Names names(8);
    Names other(8);
    Entry a{.name = "a"};
    Entry same{.name = "a"};
    names.insert(a);
    other.insert(same);
    EXPECT_EQ(-ENOENT, hash_remove(names.table(), &same.link));
    EXPECT_EQ(1u, names.table()->count);
    EXPECT_EQ(&a, names.find("a"));
    EXPECT_EQ(0, hash_remove(names.table(), &a.link));
    EXPECT_EQ(-ENOENT, hash_remove(names.table(), &a.link));
    EXPECT_EQ(0u, names.table()->count);
}

TEST(HashNext, GoesThroughTheBucketsInOrderAndThenStaysAtTheEnd) {
    Names names(8);
    // Buckets 15, 0, 1 and 1.
    Entry o{.name = "o"}, p{.name = "p"}, a{.name = "a"}, q{.name = "q"};
    for (Entry *entry : {&o, &p, &q, &a})
        names.insert(*entry);
    EXPECT_EQ("p a q o ", names.all());
    HashCursor cursor = {};
    for (int i = 0; i < 4; ++i)
        EXPECT_NE(nullptr, names.next(&cursor));
    EXPECT_EQ(nullptr, names.next(&cursor));
    EXPECT_EQ(nullptr, names.next(&cursor));
}

TEST(HashNext, GivesTheKeyAndItsLengthToWhomWantsThem) {
    Names names(8);
    Entry entry{.name = "key"};
    names.insert(entry);
    HashCursor cursor = {};
    const void *key = nullptr;
    uint32_t length = 0;
    EXPECT_EQ(&entry, hash_next(names.table(), &cursor, &key, &length, POSITION));
    EXPECT_EQ(entry.link.key, key);
    EXPECT_EQ(3u, length);
}

TEST(HashNext, CanBeginAgainAfterEveryRemoval) {
    Names names(8);
    std::vector<Entry> entries(100);
    for (size_t i = 0; i < entries.size(); ++i) {
        entries[i].name = "entry" + std::to_string(i);
        names.insert(entries[i]);
    }
    std::set<std::string> seen;
    HashCursor cursor = {};
    while (Entry *entry = names.next(&cursor)) {
        // Every other one is let pass a number of times before it goes, too.
        seen.insert(entry->name);
        if (++entry->before % 2 == 0)
            continue;
        EXPECT_EQ(0, hash_remove(names.table(), &entry->link));
        cursor = {};
    }
    EXPECT_EQ(100u, seen.size());
    EXPECT_EQ(0u, names.table()->count);
}

TEST(HashNext, GoesOnPastARemovalOfWhatItHasNotReachedYet) {
    Names names(8);
    Entry p{.name = "p"}, a{.name = "a"}, q{.name = "q"};
    for (Entry *entry : {&p, &q, &a})
        names.insert(*entry);
    HashCursor cursor = {};
    EXPECT_EQ(&p, names.next(&cursor));
    EXPECT_EQ(0, hash_remove(names.table(), &a.link));
    EXPECT_EQ(&q, names.next(&cursor));
    EXPECT_EQ(nullptr, names.next(&cursor));
}

}  // namespace
