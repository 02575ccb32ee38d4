// An index of tablespace names: finds the number that a name was entered with, whatever the number
// of names, by open addressing in a table that is at most half full.
//
// A history names its tablespaces millions of times, so a name is taken as three words, not as a
// string.
#pragma once

#include <bit>
#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "tool/zq3ckrst.h"

// A name as numbers: the same for two slots exactly when their names are the same, whatever stands
// behind the terminators.
struct nameKey {
    uint64_t head;   // characters 1 to 8
    uint64_t middle; // 9 to 16
    uint32_t tail;   // 17 and 18
};

struct nameIndexSlot {
    nameKey key;
    int number;
    bool used;
};

struct nameIndex {
    nameIndexSlot* slots; // null: not allocated
    size_t mask;
    unsigned int shift;
};

// Converts between memory order and a word whose lowest byte is the first character.
inline uint64_t firstCharacterLowest(uint64_t word)
{
    return std::endian::native == std::endian::big ? __builtin_bswap64(word) : word;
}

// Loads 8 characters; clears those from the first zero byte on.
inline uint64_t loadCharacters(const char* text)
{
    uint64_t word;
    memcpy(&word, text, sizeof word);
    word = firstCharacterLowest(word);

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

// Copies a name from slot to slot, with zeros behind it.
inline void copyName(char* target, const char* source)
{
    nameKey key = makeNameKey(source);
    uint64_t words[2] = {firstCharacterLowest(key.head), firstCharacterLowest(key.middle)};
    memcpy(target, words, sizeof words);
    target[16] = static_cast<char>(key.tail & 0xFF);
    target[17] = static_cast<char>(key.tail >> 8);
    target[18] = '\0';
}

inline bool sameName(const nameKey& first, const nameKey& second)
{
    return first.head == second.head && first.middle == second.middle && first.tail == second.tail;
}

// Allocates an index for up to capacity names. Returns false, with nothing to free, when there is
// no memory for it.
inline bool initNameIndex(nameIndex* index, size_t capacity)
{
    *index = {};
    if (capacity > SIZE_MAX / 4 / sizeof(nameIndexSlot))
        return false;

    size_t size = std::bit_ceil(capacity * 2 + 2);
    index->slots = static_cast<nameIndexSlot*>(calloc(size, sizeof(nameIndexSlot)));
    index->mask = size - 1;
    index->shift = 64 - static_cast<unsigned int>(std::countr_zero(size));
    return index->slots != nullptr;
}

inline void freeNameIndex(nameIndex* index)
{
    free(index->slots);
    *index = {};
}

// The slot that holds the key or, when it was not entered, the free one where it would stand.
inline nameIndexSlot* findNameSlot(const nameIndex* index, const nameKey& key)
{
    uint64_t hash =
        key.head ^ std::rotl(key.middle * 0x9E3779B97F4A7C15u, 29) ^ key.tail * 0xC2B2AE3D27D4EB4Fu;
    hash = (hash ^ hash >> 32) * 0xD6E8FEB86659FD93u;

    size_t at = static_cast<size_t>(hash >> index->shift);
    while (index->slots[at].used && !sameName(index->slots[at].key, key))
        at = (at + 1) & index->mask;
    return &index->slots[at];
}

// The number of the name in a slot, or -1.
inline int findName(const nameIndex* index, const char* slot)
{
    nameIndexSlot* found = findNameSlot(index, makeNameKey(slot));
    return found->used ? found->number : -1;
}

// Enters a name; one that was entered before keeps its number. Returns whether it is new.
inline bool enterName(nameIndex* index, const char* slot, int number)
{
    nameKey key = makeNameKey(slot);
    nameIndexSlot* found = findNameSlot(index, key);
    if (found->used)
        return false;
    *found = {key, number, true};
    return true;
}
