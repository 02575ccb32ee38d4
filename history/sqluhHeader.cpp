// The header: reading it, with the conversion of older versions, and writing it. Stands on the
// primitives and on the reader of entries, which older headers send it to.

#include "history/sqluhHeader.h"

#include <cstdio>
#include <cstring>

#include "history/sqluhColumns.h"
#include "history/sqluhDiagnostics.h"

static_assert(placeInFormat(headerFormat, 13).at == headerVersionAt);
static_assert(placeInFormat(headerFormat, 14).at == headerNumber15At);
static_assert(placeInFormat(headerFormat, 15).at == headerTimestampAt);
static_assert(placeInFormat(headerFormat, 16).at == headerMaxCommandAt);
static_assert(placeInFormat(headerFormat, 21).at == headerLength);

// The operations that the log names.
static constexpr char readHeader[] = "sqluhReadHeader";
static constexpr char writeHeader[] = "sqluhWriteHeader";

// --- Reading -------------------------------------------------------------------------------------

bool sqluhCheckHeaderChecksum(SQLUH_HEADER* header)
{
    pdtEntry();

    uint32_t stored = header->checksum;
    header->checksum = 0;
    bool shortImage =
        header->version >= versionWithTimestamp && header->version < versionWithWholeChecksum;
    uint32_t computed =
        sqluhChecksum(header, shortImage ? headerImageLength7020200 : headerImageLength);
    bool matches = computed == stored || sqluhChecksum(header, headerImageLengthShort) == stored;
    if (!matches && sqltGetCompTraceFlag()) {
        sqltData(__func__, "stored checksum", &stored, sizeof stored);
        sqltData(__func__, "computed checksum", &computed, sizeof computed);
    }

    pdtExit(matches);
    return matches;
}

int sqluhFindMaxCommandLen(SQLO_FHANDLE fh, uint32_t* maxLength)
{
    pdtEntry();

    zq3HistoryData data = {};
    SQLUH_ENTRY entry = {};
    entry.data = &data;
    SQLUH_WORKAREA workArea = {};
    SQLUH_ENTRYWALK walk = {fh, &entry, &workArea, 0, false};
    uint32_t longest = 0;

    int rc = logged(sqluhRewind(fh, nullptr));
    if (rc == 0)
        rc = logged(sqluhInitWorkArea(&workArea, defaultWorkAreaSize));
    if (rc == 0) {
        while ((rc = sqluhNextEntry(&walk)) == 0)
            if (entry.commandLength > longest)
                longest = entry.commandLength;
        if (rc == END_OF_FILE)
            rc = 0;
        rc = firstOf(rc, logged(sqluhRewind(fh, nullptr)));
        sqlofmblkEx(workArea.buffer);
    }
    *maxLength = longest;

    pdtExit(rc);
    return rc;
}

// Reads the header's text into buffer, which holds one byte more for the terminator.
static int readHeaderText(SQLO_FHANDLE fh, char* buffer, const char* operation)
{
    uint32_t bytesRead = 0;
    int rc = logged(sqloseek(fh, 0, sqloFromStart, nullptr), operation);
    if (rc != 0)
        return rc;

    rc = sqloread(fh, buffer, headerLength, &bytesRead);
    if (rc == 0 && bytesRead == headerLength)
        return 0;
    if (rc == END_OF_FILE && (bytesRead == 0 || bytesRead == headerLength))
        return rc;
    bool partial = rc == END_OF_FILE || rc == 0;
    logRecord({textItem(partial ? TEXT_HEADER_PARTIAL : TEXT_HEADER_READ), codeItem("rc = ", rc),
               numberItem("Bytes read: ", bytesRead), dataItem("", buffer, headerLength)},
              operation);
    return partial ? HISTORY_FILE_DAMAGED : loggedPlain(transferCode(rc), operation);
}

// Where the writer puts the fields before the status letter.
enum : unsigned int { fieldsBeforeStatus = 13 };
struct headerPlaces {
    formatPlace field[fieldsBeforeStatus];
};
static constexpr headerPlaces placesOfHeader(void)
{
    headerPlaces places = {};
    for (unsigned int i = 0; i < fieldsBeforeStatus; i++)
        places.field[i] = placeInFormat(headerFormat, i);
    return places;
}
static constexpr headerPlaces places = placesOfHeader();

// The number of a header's field, which stands as the writer writes it, a colon after it; false
// when it does not.
static inline bool takeHeaderColumns(const char* text, unsigned int field, uint32_t* number)
{
    const formatPlace place = places.field[field];
    return text[place.at + place.width] == ':' &&
           hexColumns(text + place.at + place.width - headerNumberWidth, number);
}

// Fields 1 to 13 of a header, as either way of reading takes them.
struct firstFields {
    unsigned int checksum;
    unsigned long long offsets[3];
    unsigned int numbers[7];
    unsigned short node;
    char status;
};

// Takes the fields of a header as the writer writes it; false for any other.
static bool takeFirstFields(const char* text, firstFields* fields)
{
    uint32_t low[fieldsBeforeStatus - 1];
    uint32_t high[3];
    bool taken = true;
    for (unsigned int field = 0; field < fieldsBeforeStatus - 1; field++)
        taken &= takeHeaderColumns(text, field, &low[field]);
    for (unsigned int i = 0; i < 3; i++)
        taken &= hexColumns(text + places.field[i + 1].at, &high[i]);
    if (!taken)
        return false;
    fields->checksum = low[0];
    for (unsigned int i = 0; i < 3; i++)
        fields->offsets[i] = uint64_t{high[i]} << 32 | low[i + 1];
    for (unsigned int i = 0; i < 7; i++)
        fields->numbers[i] = low[i + 4];
    fields->node = static_cast<unsigned short>(low[11]);
    fields->status = text[places.field[12].at];
    return true;
}

// The same, however they stand. What a damaged text leaves out is zero: the checksum tells.
static void scanFirstFields(const char* text, firstFields* fields)
{
    *fields = {};
    sscanf(text, headerScanFormat, &fields->checksum, &fields->offsets[0], &fields->offsets[1],
           &fields->offsets[2], &fields->numbers[0], &fields->numbers[1], &fields->numbers[2],
           &fields->numbers[3], &fields->numbers[4], &fields->numbers[5], &fields->numbers[6],
           &fields->node, &fields->status);
}

static void takeHeaderFields(const char* text, SQLUH_HEADER* header)
{
    firstFields fields;
    if (!takeFirstFields(text, &fields))
        scanFirstFields(text, &fields);
    header->checksum = fields.checksum;
    header->offset1 = fields.offsets[0];
    header->offset2 = fields.offsets[1];
    header->offset3 = fields.offsets[2];
    header->entryCount = fields.numbers[0];
    header->number6 = fields.numbers[1];
    header->number7 = fields.numbers[2];
    header->number8 = fields.numbers[3];
    header->number9 = fields.numbers[4];
    header->number10 = fields.numbers[5];
    header->number11 = fields.numbers[6];
    header->nodeNumber = fields.node;
    header->status = fields.status;
}

// A number as the writer writes it, or as strtoul takes it.
static uint32_t headerNumber(const char* text, int base)
{
    uint32_t number = 0;
    if (base == 10 ? decimalColumns(text, &number) : hexColumns(text, &number))
        return number;
    return numberAt(text, headerNumberWidth, base);
}

// The fields after the status letter, which stand at places that depend on the version. Returns
// the place of field 17.
static uint32_t takeVersionedFields(const char* text, SQLUH_HEADER* header)
{
    header->version = headerNumber(text + headerVersionAt, 10);
    if (header->version < versionWithNumber15)
        return headerMaxCommandAt6010000;
    header->number15 = headerNumber(text + headerNumber15At, 16);
    if (header->version < versionWithTimestamp)
        return headerMaxCommandAt7020200;
    if (text[headerTimestampAt] == SQLUH_EMPTY_WORD[0]) {
        memset(header->timestamp, ' ', timestampWidth);
        return headerMaxCommandAtNoTimestamp;
    }
    memcpy(header->timestamp, text + headerTimestampAt, timestampWidth);
    return headerMaxCommandAt;
}

// Parses the header's text. Returns 0, or HISTORY_FILE_DAMAGED when the entries had to be scanned
// for field 17 and could not be.
static int parseHeader(SQLO_FHANDLE fh, const char* text, SQLUH_HEADER* header,
                       const char* operation)
{
    memset(header, 0, sizeof *header);
    takeHeaderFields(text, header);
    uint32_t maxCommandAt = takeVersionedFields(text, header);
    if (text[maxCommandAt] != ' ') {
        header->maxCommandLength = headerNumber(text + maxCommandAt, 16);
        return 0;
    }
    uint32_t longest = 0;
    int rc = sqluhFindMaxCommandLen(fh, &longest);
    header->maxCommandLength = longest;
    return rc == 0 ? 0 : loggedPlain(HISTORY_FILE_DAMAGED, operation);
}

// Takes the header's timestamp from the entry at offset3.
static int takeTimestampFromEntry(SQLO_FHANDLE fh, SQLUH_HEADER* header)
{
    char objectPart[zq3ObjectPartCapacity] = {};
    zq3HistoryData data = {};
    data.objectPart.data = objectPart;
    data.objectPart.capacity = sizeof objectPart;
    SQLUH_ENTRY entry = {};
    entry.data = &data;
    SQLUH_WORKAREA workArea = {};
    SQLUH_ENTRYWALK walk = {fh, &entry, &workArea, 0, false};

    int rc = logged(sqloseek(fh, static_cast<long long>(header->offset3), sqloFromStart, nullptr),
                    readHeader);
    // The reader grows the area for a larger entry, and only as far as the file is long.
    if (rc == 0)
        rc = logged(sqluhInitWorkArea(&workArea, defaultWorkAreaSize), readHeader);
    if (rc == 0) {
        rc = logged(sqluhNextEntry(&walk), readHeader);
        sqlofmblkEx(workArea.buffer);
    }
    if (rc != 0)
        return rc;

    // The header's text can carry neither a zero byte nor a leading "-" here; blanks, which also
    // stand for an empty timestamp, keep the next header that is written readable.
    for (uint32_t i = 0; i < timestampWidth; i++)
        header->timestamp[i] = objectPart[i] != '\0' ? objectPart[i] : ' ';
    if (objectPart[0] == SQLUH_EMPTY_WORD[0])
        memset(header->timestamp, ' ', timestampWidth);
    return logged(sqluhRewind(fh, nullptr), readHeader);
}

// Brings a header of a version below 7020200 into the current form, in memory.
static int convertOldHeader(SQLO_FHANDLE fh, SQLUH_HEADER* header)
{
    if (header->offset3 != 0) {
        int rc = takeTimestampFromEntry(fh, header);
        if (rc != 0)
            return rc;
    } else {
        memcpy(header->timestamp, SQLUH_EMPTY_TIMESTAMP, timestampWidth);
    }
    if (header->version < versionWithNumber15)
        header->number15 = header->number7;
    header->version = currentVersion;
    return 0;
}

int sqluhTakeHeader(SQLO_FHANDLE fh, SQLUH_HEADER* header, const char* operation)
{
    void* block = nullptr;
    int rc = logged(allocateZeroed(headerLength + 1, &block), operation);
    if (rc == 0) {
        char* text = static_cast<char*>(block);
        rc = readHeaderText(fh, text, operation);
        if (rc == 0) {
            int scanned = parseHeader(fh, text, header, operation);
            rc = sqluhCheckHeaderChecksum(header) ? 0 : logged(HISTORY_FILE_DAMAGED, operation);
            if (rc == 0 && header->version < versionWithTimestamp)
                rc = convertOldHeader(fh, header);
            rc = firstOf(rc, scanned);
        }
        sqlofmblkEx(block);
    }
    if (rc < 0 && rc != END_OF_FILE && operation != nullptr) {
        sqlt_logadmin(operation, pdAdminReadFailed);
        logRecord({textItem(TEXT_HEADER_FAILED)}, operation);
    }
    return rc;
}

int sqluhReadHeader(SQLO_FHANDLE fh, SQLUH_HEADER* header)
{
    pdtEntry();
    int rc = sqluhTakeHeader(fh, header, __func__);
    pdtExit(rc);
    return rc;
}

// --- Writing -------------------------------------------------------------------------------------

static int formatHeader(char* buffer, const SQLUH_HEADER* header)
{
    return sqluhSprintf(
        buffer, headerFormat, header->checksum, static_cast<unsigned long long>(header->offset1),
        static_cast<unsigned long long>(header->offset2),
        static_cast<unsigned long long>(header->offset3), header->entryCount, header->number6,
        header->number7, header->number8, header->number9, header->number10, header->number11,
        header->nodeNumber, header->status, header->version, header->number15, header->timestamp,
        header->maxCommandLength, " ", " ", " ", " ");
}

static int writeHeaderText(SQLO_FHANDLE fh, const char* buffer)
{
    uint32_t written = 0;
    int rc = logged(sqlowrite(fh, buffer, headerLength, &written), writeHeader);
    if (rc == 0 && written == headerLength)
        return 0;
    if (rc == DISK_FULL)
        sqlt_logadmin(writeHeader, pdAdminDiskFull);
    // A header cut short with no code for it is a damaged header.
    return rc != 0 ? transferCode(rc) : logged(HISTORY_FILE_DAMAGED, writeHeader);
}

int sqluhWriteHeader(SQLO_FHANDLE fh, SQLUH_HEADER* header)
{
    pdtEntry();

    void* block = nullptr;
    int rc = logged(allocateZeroed(headerLength + 1, &block));
    if (rc == 0) {
        char* buffer = static_cast<char*>(block);
        header->version = currentVersion;
        header->checksum = 0;
        header->checksum = sqluhChecksum(header, headerImageLength);
        rc = logged(sqloseek(fh, 0, sqloFromStart, nullptr));
        if (rc == 0) {
            int length = formatHeader(buffer, header);
            if (length != static_cast<int>(headerLength)) {
                rc = HISTORY_FILE_DAMAGED;
                logRecord({codeItem("rc = ", rc), numberItem("Length: ", length)});
            }
        }
        if (rc == 0)
            rc = writeHeaderText(fh, buffer);
        sqlofmblkEx(block);
    }

    pdtExit(rc);
    return rc;
}
