#include "mon/hash_table.h"

#include <errno.h>
#include <stdlib.h>
#include <string.h>

namespace {

constexpr uint32_t DEFAULT_BUCKETS = 16;
constexpr uint32_t MULTIPLIER = 65599;

uint32_t length_of(const void *key, uint32_t key_length) {
    return key_length != 0 ? key_length
                           : static_cast<uint32_t>(strlen(static_cast<const char *>(key)));
}

uint32_t bucket_of(const HashTable *table, const void *key, uint32_t length) {
    return hash_key(key, length) & (table->bucket_count - 1);
}

void *record_of(const HashLink *link, size_t position) {
    return reinterpret_cast<char *>(const_cast<HashLink *>(link)) - position;
}

}  // namespace

uint32_t hash_key(const void *key, uint32_t length) {
    const unsigned char *bytes = static_cast<const unsigned char *>(key);
    uint32_t hash = 0;
    for (uint32_t i = 0; i < length; ++i)
        hash = hash * MULTIPLIER + bytes[i];
    return hash;
}

HashTable *hash_create(uint32_t size_hint) {
    uint64_t buckets = DEFAULT_BUCKETS;
    if (size_hint != 0) {
        for (buckets = 1; buckets <= size_hint;)
            buckets *= 2;
    }
    // The one bucket of the declaration is the spare one.
    const uint64_t size = sizeof(HashTable) + buckets * sizeof(HashTable::buckets);
    if (buckets > UINT32_MAX || size > SIZE_MAX)
        return nullptr;
    HashTable *table = static_cast<HashTable *>(calloc(1, static_cast<size_t>(size)));
    if (table != nullptr)
        table->bucket_count = static_cast<uint32_t>(buckets);
    return table;
}

int hash_insert(HashTable *table, const void *key, uint32_t key_length, HashLink *link) {
    const uint32_t length = length_of(key, key_length);
    void *copy = malloc(length);
    if (copy == nullptr && length != 0)
        return -ENOMEM;
    if (length != 0)
        memcpy(copy, key, length);
    HashLink **head = &table->buckets[bucket_of(table, key, length)];
    *link = {*head, copy, length};
    *head = link;
    ++table->count;
    return 0;
}

int hash_remove(HashTable *table, HashLink *link) {
    HashLink **place = &table->buckets[bucket_of(table, link->key, link->key_length)];
    while (*place != nullptr && *place != link)
        place = &(*place)->next;
    if (*place == nullptr)
        return -ENOENT;
    *place = link->next;
    free(link->key);
    *link = {};
    --table->count;
    return 0;
}

void *hash_find(const HashTable *table, const void *key, uint32_t key_length, size_t position) {
    const uint32_t length = length_of(key, key_length);
    const HashLink *link = table->buckets[bucket_of(table, key, length)];
    for (; link != nullptr; link = link->next) {
        if (link->key_length == length && (length == 0 || memcmp(link->key, key, length) == 0))
            return record_of(link, position);
    }
    return nullptr;
}

void *hash_next(const HashTable *table, HashCursor *cursor, const void **key, uint32_t *key_length,
                size_t position) {
    const HashLink *link = nullptr;
    if (cursor->last != nullptr) {
        link = cursor->last->next;
        if (link == nullptr)
            ++cursor->bucket;
    }
    while (link == nullptr && cursor->bucket < table->bucket_count) {
        link = table->buckets[cursor->bucket];
        if (link == nullptr)
            ++cursor->bucket;
    }
    cursor->last = link;
    if (link == nullptr)
        return nullptr;
    if (key != nullptr)
        *key = link->key;
    if (key_length != nullptr)
        *key_length = link->key_length;
    return record_of(link, position);
}

void hash_destroy(HashTable *table) {
    for (uint32_t i = 0; i < table->bucket_count; ++i) {
        for (const HashLink *link = table->buckets[i]; link != nullptr; link = link->next)
            free(link->key);
    }
    free(table);
}
