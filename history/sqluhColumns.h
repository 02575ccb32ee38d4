// Numbers and words in text, by column; most of them eight characters at a time, as one 64-bit
// word.
//
// Those that can refuse decide only whether a text stands exactly as the writer writes it and what
// it then says. What they refuse of a fixed part goes through the scanning formats, which accept
// more.
#pragma once

#include <bit>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>

// The file's words, and the header's image, are little-endian.
static_assert(std::endian::native == std::endian::little);

// The eight characters at text, the first in the lowest byte.
static inline uint64_t columnsAt(const char* text)
{
    uint64_t word;
    memcpy(&word, text, sizeof word);
    return word;
}

static constexpr uint64_t everyByte(uint64_t value)
{
    return value * 0x0101010101010101;
}

// Reads eight hexadecimal digits of either case; false when another character stands among them.
static inline bool hexColumns(const char* text, uint32_t* value)
{
    uint64_t word = columnsAt(text);
    uint64_t letter = word >> 6 & everyByte(0x01); // 1 where the character is no decimal digit
    uint64_t nibble = word & everyByte(0x0F);
    uint64_t digit = nibble + letter * 9;
    // 0x3n, or for a letter 0x4n or 0x6n; digits 0 to 9, letters 1 to 6.
    uint64_t zone = word & (everyByte(0xF0) ^ letter << 5);
    uint64_t wrong = zone ^ (everyByte(0x30) ^ letter * 0x70);
    wrong |= (nibble + everyByte(0x06) + letter * 3) & everyByte(0x10);
    wrong |= ~(nibble + everyByte(0x0F)) >> 4 & letter;
    if (wrong != 0)
        return false;
    digit = (digit << 4 | digit >> 8) & 0x00FF00FF00FF00FF;
    digit = (digit << 8 | digit >> 16) & 0x0000FFFF0000FFFF;
    *value = static_cast<uint32_t>(digit << 16 | digit >> 32);
    return true;
}

// Value of each character as a hexadecimal digit, or 0xFF.
struct digitTable {
    uint8_t value[256];
};

static constexpr digitTable makeDigitTable(void)
{
    digitTable table = {};
    for (unsigned int c = 0; c < 256; c++)
        table.value[c] = static_cast<uint8_t>(c >= '0' && c <= '9'   ? c - '0'
                                              : c >= 'A' && c <= 'F' ? c - 'A' + 10
                                              : c >= 'a' && c <= 'f' ? c - 'a' + 10
                                                                     : 0xFF);
    return table;
}
static constexpr digitTable hexDigits = makeDigitTable();

// Reads width hexadecimal digits; false when another character stands among them.
static inline bool hexDigitsAt(const char* text, uint32_t width, uint32_t* value)
{
    uint32_t result = 0;
    uint32_t seen = 0;
    for (uint32_t i = 0; i < width; i++) {
        uint32_t digit = hexDigits.value[static_cast<unsigned char>(text[i])];
        seen |= digit;
        result = result << 4 | (digit & 0x0F);
    }
    *value = result;
    return seen <= 0x0F;
}

// Reads eight decimal digits; false when another character stands among them.
static inline bool decimalColumns(const char* text, uint32_t* value)
{
    uint64_t digits = columnsAt(text) ^ everyByte('0');
    if (((digits + everyByte(0x76)) | digits) & everyByte(0x80))
        return false;
    digits = digits * 10 + (digits >> 8); // every second byte now holds a pair, 0 to 99
    uint64_t high = (digits & 0x000000FF000000FF) * 0x000F424000000064;      // 10^6 and 10^2
    uint64_t low = (digits >> 16 & 0x000000FF000000FF) * 0x0000271000000001; // 10^4 and 1
    *value = static_cast<uint32_t>((high + low) >> 32);
    return true;
}

// The number in width characters (at most 31) as strtoul takes it, which accepts more than the
// above: 0 where there is none.
static inline uint32_t numberAt(const char* text, uint32_t width, int base)
{
    char digits[32];
    memcpy(digits, text, width);
    digits[width] = '\0';
    return static_cast<uint32_t>(strtoul(digits, nullptr, base));
}

// The length of a field's text when it is one word of printable ASCII with blanks after it up to
// width; 0 when it is anything else. Whatever a locale calls white space, the scanning format takes
// such a field the same way.
static inline uint32_t wordLength(const char* text, uint32_t width)
{
    uint32_t length = 0;
    while (length < width && text[length] > ' ' && text[length] < 0x7F)
        length++;
    for (uint32_t i = length; i < width; i++)
        if (text[i] != ' ')
            return 0;
    return length;
}

// memcpy for the short texts that entries are full of: two overlapping moves instead of a call.
static inline void copyShort(char* target, const char* from, size_t length)
{
    if (length >= 8 && length <= 16) {
        uint64_t head;
        uint64_t tail;
        memcpy(&head, from, sizeof head);
        memcpy(&tail, from + length - sizeof tail, sizeof tail);
        memcpy(target, &head, sizeof head);
        memcpy(target + length - sizeof tail, &tail, sizeof tail);
    } else {
        memcpy(target, from, length);
    }
}

// The place and the width that a format text gives to one of its conversions.
struct formatPlace {
    uint32_t at;
    uint32_t width;
};

// Finds the conversion with this number, counted from 0, in a printing or scanning format whose
// conversions all have their width, or are %c; past the last one, the length of the whole text.
static constexpr formatPlace placeInFormat(const char* format, unsigned int number)
{
    formatPlace place = {0, 0};
    for (; *format != '\0'; format++) {
        place.at += place.width;
        place.width = 1; // a character that stands for itself, or %c
        if (*format != '%')
            continue;
        uint32_t digits = 0;
        for (format++; *format == '-' || *format == '+'; format++)
            continue;
        for (; *format >= '0' && *format <= '9'; format++)
            digits = digits * 10 + static_cast<uint32_t>(*format - '0');
        for (; *format == '.' || (*format >= '0' && *format <= '9') || *format == 'h' ||
               *format == 'l';
             format++)
            continue;
        if (*format != 'c')
            place.width = digits;
        if (number-- == 0)
            return place;
    }
    return {place.at + place.width, 0};
}
