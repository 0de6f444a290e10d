// A chained hash table whose links lie inside the records that it holds.
//
// The table owns copies of the keys and borrows the records: they must stay where they are for as
// long as they are in it. It never grows. Not for use by several threads at once.
#pragma once

#include <stddef.h>
#include <stdint.h>

// One per record and table; zero, or anything, before it is inserted.
struct HashLink {
    HashLink *next;
    void *key;  // owned by the table
    uint32_t key_length;
};

struct HashTable {
    uint32_t count;
    uint32_t bucket_count;  // a power of two
    HashLink *buckets[1];   // allocated `bucket_count` long, with one more that stays null
};

// Where an iteration stands; all zero to begin one.
struct HashCursor {
    uint32_t bucket;
    const HashLink *last;
};

// h = h * 65599 + byte, modulo 2^32, over all bytes of the key.
uint32_t hash_key(const void *key, uint32_t length);

// A table with the smallest power of two of buckets that is greater than `size_hint`, or with 16
// for a hint of 0. Null when there is no memory for it.
HashTable *hash_create(uint32_t size_hint);

// In the following, a key length of 0 stands for a zero-terminated key, without its zero. Where a
// record is given or returned, `position` is the offset of its link.

// Puts the record of `link` under a copy of the key, before others of its bucket; whether the key
// is there already is not looked at. Returns 0, or -ENOMEM, and then has changed nothing.
int hash_insert(HashTable *table, const void *key, uint32_t key_length, HashLink *link);

// Takes a record out. Returns 0, or -ENOENT when it is not in the table under its key.
int hash_remove(HashTable *table, HashLink *link);

// The record that was last inserted under the key, or null.
void *hash_find(const HashTable *table, const void *key, uint32_t key_length, size_t position);

// The next record, bucket by bucket, or null after the last one. Its key and the key's length are
// stored in `key` and `key_length` where these are not null, the key borrowed from the table. The
// record that was returned last must still be in the table.
void *hash_next(const HashTable *table, HashCursor *cursor, const void **key, uint32_t *key_length,
                size_t position);

// Frees the table and the keys of all that is in it; the records, which are looked at once more for
// that, stay with the caller.
void hash_destroy(HashTable *table);
