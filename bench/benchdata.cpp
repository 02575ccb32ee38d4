// Sample histories, and the floor.

#include "bench/bench.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>

enum : uint32_t {
    entriesPerDay = 4,
    restoreInterval = 1000,
    restorePlace = 499,
    renamePlace = 249,
    creationPlace = 3001,
};

static void setText(textBuffer* text, char* data)
{
    text->data = data;
    text->length = static_cast<uint32_t>(strlen(data));
    text->capacity = text->length + 1;
}

static void nameTablespace(sampleEntry* sample, uint32_t number, uint32_t renames)
{
    char* slot = &sample->slots[number * slotSize];
    snprintf(slot, slotSize, "TS%05uG%02u", number % 100000, renames % 100);
    setText(&sample->names[number], slot);
}

void initSample(sampleEntry* sample, uint32_t tablespaces)
{
    static char note[] = "nightly run";
    static char log[] = "S0001234.LOG";
    *sample = {};
    sample->names.resize(tablespaces + 2);
    sample->slots.resize(sample->names.size() * slotSize);
    for (uint32_t i = 0; i < sample->names.size(); i++)
        nameTablespace(sample, i, 0);
    sqloinca(&sample->event);
    sample->entry.data = &sample->data;
    sample->entry.sqlcaLength = sqlcaLineLength;
    sample->data.eventSqlca = &sample->event;
    sample->data.tablespaceBuffers = sample->names.data();
    sample->data.maxTablespaces = tablespaces;
    sample->data.status = 'A';
    setText(&sample->data.noteText, note);
    setText(&sample->data.firstText, log);
    setText(&sample->data.lastText, log);
    sample->entry.noteLength = sample->data.noteText.length;
}

// A calendar of twelve months of 28 days is calendar enough. text holds the sequence number and a
// terminator too.
static void formatTimestamp(char* text, const char* sequence, uint32_t index)
{
    uint32_t day = index / entriesPerDay;
    char digits[64];
    snprintf(digits, sizeof digits, "%04u%02u%02u%02u1500", 2000 + day / 336, day / 28 % 12 + 1,
             day % 28 + 1, index % entriesPerDay * 6);
    memcpy(text, digits, timestampWidth);
    memcpy(text + timestampWidth, sequence, strlen(sequence) + 1);
}

std::string sampleTimestamp(uint32_t index)
{
    char text[timestampWidth + 1];
    formatTimestamp(text, "", index);
    return text;
}

static char backupType(uint32_t index)
{
    if (index % entriesPerDay != 0)
        return 'E';
    return index / entriesPerDay % 7 == 0 ? 'F' : 'O';
}

// A rename lists the old name, then the new one, which every later entry uses.
static void becomeRename(sampleEntry* sample, uint32_t index, uint32_t tablespaces)
{
    uint32_t count = index / restoreInterval;
    uint32_t number = count % tablespaces;
    char* scratch = &sample->slots[tablespaces * slotSize];
    memcpy(scratch, sample->names[number].data, slotSize);
    nameTablespace(sample, number, count / tablespaces + 1);
    memcpy(scratch + slotSize, sample->names[number].data, slotSize);
    sample->data.operation = 'N';
    sample->data.tablespaceBuffers = &sample->names[tablespaces];
    sample->data.numTablespaces = 2;
}

void nextSample(sampleEntry* sample, uint32_t index)
{
    zq3HistoryData* data = &sample->data;
    uint32_t tablespaces = data->maxTablespaces;
    formatTimestamp(sample->timestamp, "001", index);
    setText(&data->objectPart, sample->timestamp);
    setText(&data->secondTimestamp, sample->timestamp);
    data->secondTimestamp.length = timestampWidth;
    data->entryNumber = index;
    data->operation = 'B';
    data->object = 'D';
    data->operationType = backupType(index);
    data->idText = {};
    data->tablespaceBuffers = sample->names.data();
    data->numTablespaces = tablespaces;
    if (tablespaces < 2)
        return;

    // The last tablespace exists only from its creation on.
    if (index <= creationPlace)
        data->numTablespaces--;
    if (index == creationPlace) {
        data->operation = 'A';
        data->tablespaceBuffers = &sample->names[tablespaces - 1];
        data->numTablespaces = 1;
    } else if (index % restoreInterval == restorePlace) {
        data->operation = 'R';
        formatTimestamp(sample->idText, "", index - 2);
        setText(&data->idText, sample->idText);
    } else if (index % restoreInterval == renamePlace) {
        becomeRename(sample, index, tablespaces);
    }
}

std::string sizeName(uint32_t entries, uint32_t tablespaces)
{
    return std::to_string(entries) + "x" + std::to_string(tablespaces);
}

std::string historyFileOf(const std::string& directory)
{
    return directory + SQLUH_HISTORY_NAME;
}

// Names the last tablespace anew; the last entry, which a plan starts from, does without it.
static void makeDifferent(sampleEntry* sample, uint32_t index, uint32_t entries)
{
    uint32_t last = sample->data.maxTablespaces - 1;
    snprintf(&sample->slots[last * slotSize], slotSize, "TX%08u", index);
    setText(&sample->names[last], &sample->slots[last * slotSize]);
    sample->data.numTablespaces -= index == entries - 1;
}

// Through a handle that nobody else can know yet: a lock and a batch would only copy the file.
static void writeEntries(SQLUH_HANDLE* handle, uint32_t entries, uint32_t tablespaces,
                         bool different)
{
    sampleEntry sample;
    initSample(&sample, tablespaces);
    handle->replayArea.replayDisabled = 1;
    for (uint32_t i = 0; i < entries; i++) {
        nextSample(&sample, i);
        if (different)
            makeDifferent(&sample, i, entries);
        check(sqluhWriteEntry(handle, &sample.entry), "sqluhWriteEntry");
    }
    handle->header.entryCount = entries;
    handle->header.number8 = tablespaces;
    check(sqluhWriteHeader(handle->fileHandle, &handle->header), "sqluhWriteHeader");
}

std::string makeHistory(const std::string& parent, uint32_t entries, uint32_t tablespaces,
                        bool different)
{
    std::string directory = parent + sizeName(entries, tablespaces) + "/";
    mkdir(directory.c_str(), 0750);
    SQLUH_HANDLE* handle = nullptr;
    check(sqluhCreate(directory.data()), "sqluhCreate");
    check(sqluhHandleAllocAndInit(directory.data(), &handle), "sqluhHandleAllocAndInit");
    check(sqloopenp(handle->historyPath, sqloOpenUpdate, sqloPermissions, &handle->fileHandle),
          "sqloopenp");
    check(sqluhReadHeader(handle->fileHandle, &handle->header), "sqluhReadHeader");
    writeEntries(handle, entries, tablespaces, different);
    check(sqloclose(handle->fileHandle), "sqloclose");
    check(sqlocopy(handle->historyPath, handle->shadowPath, 0), "sqlocopy");
    sqluhHandleFree(&handle);
    return directory;
}

uint64_t readFloor(const std::string& path)
{
    static uint64_t piece[(size_t{1} << 20) / sizeof(uint64_t)];
    uint64_t lanes[8] = {};
    int descriptor = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    check(descriptor < 0, "open");
    ssize_t got = 0;
    while ((got = read(descriptor, piece, sizeof piece)) > 0) {
        size_t words = static_cast<size_t>(got) / sizeof piece[0];
        for (size_t i = 0; i + 8 <= words; i += 8)
            for (size_t lane = 0; lane < 8; lane++)
                lanes[lane] ^= piece[i + lane];
    }
    close(descriptor);
    uint64_t sum = 0;
    for (uint64_t lane : lanes)
        sum ^= lane;
    return sum;
}
