// The header reader: whatever it accepts must survive being written and read again.

#include <cstring>

#include "history/sqluhist.h"
#include "memoryfile.h"

// Puts the checksum that the header asks for over its first characters, so that mutations reach
// what comes after the test. Only the image of the plain reading is tried.
static void stamp(char* text)
{
    SQLUH_HEADER header;
    serveFile(reinterpret_cast<uint8_t*>(text), headerLength);
    memcpy(text, "00000000", 8);
    if (sqluhReadHeader(memoryHandle, &header) == 0)
        return;
    header.checksum = 0;
    bool middle = header.version >= 7020200 && header.version < 8010000;
    char digits[9];
    sqluhSprintf(digits, checksumFormat, sqluhChecksum(&header, middle ? 72 : 92));
    memcpy(text, digits, 8);
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    static char file[1024 + 5120];
    if (size == 0 || size > sizeof file)
        return 0;
    memcpy(file, data + 1, size - 1);
    // The first byte says whether the checksum is made to match.
    if ((data[0] & 1) != 0 && size > headerLength)
        stamp(file);

    SQLUH_HEADER header, again;
    serveFile(reinterpret_cast<uint8_t*>(file), size - 1);
    int rc = sqluhReadHeader(memoryHandle, &header);
    REQUIRE(rc <= 0);
    if (rc != 0)
        return 0;
    REQUIRE(filePosition == headerLength && header.checksum == 0);

    uint32_t version = header.version;
    REQUIRE(sqluhWriteHeader(memoryHandle, &header) == 0);
    // The text cannot carry these; the reader takes them from files that nobody here wrote.
    if (header.status == '\0' || header.timestamp[0] == '-' || version < 7020200 ||
        memchr(header.timestamp, '\0', sizeof header.timestamp) != nullptr)
        return 0;
    serveFile(reinterpret_cast<uint8_t*>(lastHeader), sizeof lastHeader);
    REQUIRE(sqluhReadHeader(memoryHandle, &again) == 0);
    header.checksum = 0;
    REQUIRE(memcmp(&header, &again, sizeof header) == 0);
    return 0;
}
