// Finds records by their tablespace names, whatever the number of records, in memory of the records
// themselves: each also heads one of the buckets that the names are spread over. A record has the
// members name, a slot, and links.
//
// A history names its tablespaces millions of times, so a name is taken as three words, not as a
// string.
#pragma once

#include <bit>
#include <cstdint>
#include <cstring>

#include "tool/zq3ckrst.h"

static_assert(std::endian::native == std::endian::little, "a word's lowest byte comes first");

// A name as numbers: the same for two slots exactly when their names are the same, whatever stands
// after the terminators.
struct nameKey {
    uint64_t head;   // characters 1 to 8
    uint64_t middle; // 9 to 16
    uint32_t tail;   // 17 and 18
};

// Loads 8 characters; clears those from the first zero byte on.
inline uint64_t loadCharacters(const char* text)
{
    uint64_t word;
    memcpy(&word, text, sizeof word);

    uint64_t zeros = (word - 0x0101010101010101u) & ~word & 0x8080808080808080u;
    return word & ((zeros - 1) & ~zeros);
}

// The key of the name in a slot of nameSize bytes.
inline nameKey makeNameKey(const char* slot)
{
    const uint64_t lastCharacter = 0xFFull << 56;
    nameKey key = {loadCharacters(slot), loadCharacters(slot + 8), 0};
    if ((key.head & lastCharacter) == 0)
        key.middle = 0;
    if ((key.middle & lastCharacter) != 0 && slot[16] != 0)
        key.tail = static_cast<uint32_t>(static_cast<uint8_t>(slot[16]) |
                                         static_cast<uint8_t>(slot[17]) << 8);
    return key;
}

// Copies a name from slot to slot, with zeros after it.
inline void copyName(char* target, const char* source)
{
    nameKey key = makeNameKey(source);
    uint64_t words[2] = {key.head, key.middle};
    memcpy(target, words, sizeof words);
    target[16] = static_cast<char>(key.tail & 0xFF);
    target[17] = static_cast<char>(key.tail >> 8);
    target[nameSize - 1] = '\0';
}

inline bool sameName(const nameKey& first, const nameKey& second)
{
    return first.head == second.head && first.middle == second.middle && first.tail == second.tail;
}

// The bucket of a key, of so many.
inline size_t bucketOf(const nameKey& key, size_t buckets)
{
    uint64_t hash =
        key.head ^ std::rotl(key.middle * 0x9E3779B97F4A7C15u, 29) ^ key.tail * 0xC2B2AE3D27D4EB4Fu;
    hash = (hash ^ hash >> 32) * 0xD6E8FEB86659FD93u;
    return static_cast<size_t>((hash >> 32) * buckets >> 32);
}

// The number of the record with the name in a slot, or -1.
template <typename Record> int findName(const Record* records, size_t buckets, const char* slot)
{
    nameKey key = makeNameKey(slot);
    uint32_t at = records[bucketOf(key, buckets)].links.first;
    while (at != 0 && !sameName(makeNameKey(records[at - 1].name), key))
        at = records[at - 1].links.next;
    return static_cast<int>(at) - 1;
}

// Enters the name of a record, which no entered one has.
template <typename Record> void enterName(Record* records, size_t buckets, size_t number)
{
    uint32_t* first = &records[bucketOf(makeNameKey(records[number].name), buckets)].links.first;
    records[number].links.next = *first;
    *first = static_cast<uint32_t>(number + 1);
}

// Forgets all names and enters those of the first count records; there are as many buckets as
// records.
template <typename Record> void enterNames(Record* records, size_t buckets, size_t count)
{
    for (size_t i = 0; i < buckets; i++)
        records[i].links = {};
    for (size_t i = 0; i < count; i++)
        enterName(records, buckets, i);
}
