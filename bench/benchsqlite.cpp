// The same records in SQLite.

#include "bench/bench.h"

#include <sqlite3.h>

#include <cstring>

static constexpr char createText[] =
    "CREATE TABLE IF NOT EXISTS history(number INTEGER, node INTEGER, version INTEGER, status TEXT,"
    " operation TEXT, object TEXT, type TEXT, timestamp TEXT, second TEXT, first TEXT, last TEXT,"
    " position BLOB, id TEXT, aux TEXT, note TEXT, sqlcode INTEGER, names TEXT)";
enum : int { columns = 17, namesColumn = 16 };

static void execute(sqlite3* database, const char* sql)
{
    check(sqlite3_exec(database, sql, nullptr, nullptr, nullptr), sql);
}

static sqlite3_stmt* prepare(sqlite3* database, const char* sql)
{
    sqlite3_stmt* statement = nullptr;
    check(sqlite3_prepare_v2(database, sql, -1, &statement, nullptr), sql);
    return statement;
}

sqlite3* openTable(const std::string& path, const char* synchronous)
{
    sqlite3* database = nullptr;
    check(sqlite3_open(path.c_str(), &database), "sqlite3_open");
    execute(database, (std::string("PRAGMA synchronous=") + synchronous).c_str());
    return database;
}

sqlite3_stmt* prepareInsert(sqlite3* database)
{
    return prepare(database, "INSERT INTO history VALUES(?,?,?,?,?,?,?,?,?,?,?,?,?,?,?,?,?)");
}

static void bindText(sqlite3_stmt* insert, int column, const textBuffer* text)
{
    sqlite3_bind_text(insert, column, text->data, static_cast<int>(text->length), SQLITE_STATIC);
}

static void bindLetter(sqlite3_stmt* insert, int column, const char* letter)
{
    sqlite3_bind_text(insert, column, letter, 1, SQLITE_STATIC);
}

void insertSample(sqlite3_stmt* insert, const sampleEntry* sample)
{
    const zq3HistoryData* data = &sample->data;
    std::string names;
    for (uint32_t i = 0; i < data->numTablespaces; i++)
        names.append(data->tablespaceBuffers[i].data, data->tablespaceBuffers[i].length) += '\n';
    int at = 0;
    sqlite3_bind_int64(insert, ++at, data->entryNumber);
    sqlite3_bind_int(insert, ++at, data->entryNode);
    sqlite3_bind_int64(insert, ++at, currentVersion);
    bindLetter(insert, ++at, &data->status);
    bindLetter(insert, ++at, &data->operation);
    bindLetter(insert, ++at, &data->object);
    bindLetter(insert, ++at, &data->operationType);
    for (const textBuffer* text :
         {&data->objectPart, &data->secondTimestamp, &data->firstText, &data->lastText})
        bindText(insert, ++at, text);
    sqlite3_bind_blob(insert, ++at, data->logPosition, sizeof data->logPosition, SQLITE_STATIC);
    bindText(insert, ++at, &data->idText);
    bindLetter(insert, ++at, &data->auxCode);
    bindText(insert, ++at, &data->noteText);
    sqlite3_bind_int(insert, ++at, data->eventSqlca->sqlcode);
    sqlite3_bind_text(insert, ++at, names.c_str(), static_cast<int>(names.size()), SQLITE_STATIC);
    check(sqlite3_step(insert) != SQLITE_DONE, "INSERT");
    sqlite3_reset(insert);
}

std::string makeTable(const std::string& directory, uint32_t entries, uint32_t tablespaces)
{
    std::string path =
        directory + "columns" + std::to_string(entries) + "x" + std::to_string(tablespaces) + ".db";
    sqlite3* database = openTable(path, "OFF");
    execute(database, createText);
    sqlite3_stmt* insert = prepareInsert(database);
    sampleEntry sample;
    initSample(&sample, tablespaces);
    execute(database, "BEGIN");
    for (uint32_t i = 0; i < entries; i++) {
        nextSample(&sample, i);
        insertSample(insert, &sample);
    }
    execute(database, "COMMIT");
    sqlite3_finalize(insert);
    sqlite3_close(database);
    return path;
}

// Takes a column's text as the library's reader does: into a buffer of the caller's.
static void takeText(sqlite3_stmt* select, int column, char* buffer, size_t capacity)
{
    const void* bytes = sqlite3_column_blob(select, column);
    size_t size = static_cast<size_t>(sqlite3_column_bytes(select, column));
    size_t copied = size < capacity ? size : capacity - 1;
    if (copied != 0)
        memcpy(buffer, bytes, copied);
    buffer[copied] = '\0';
}

// Takes the names apart into slots of 19 bytes, as a plan or a person needs them.
static void takeNames(sqlite3_stmt* select, int column, std::vector<char>* slots)
{
    const char* at = static_cast<const char*>(sqlite3_column_blob(select, column));
    const char* end = at + sqlite3_column_bytes(select, column);
    for (size_t slot = 0; at < end; slot += slotSize) {
        const void* found = memchr(at, '\n', static_cast<size_t>(end - at));
        size_t length = static_cast<size_t>(static_cast<const char*>(found) - at);
        if (slot + slotSize > slots->size())
            slots->resize(2 * slots->size());
        memcpy(&(*slots)[slot], at, length);
        (*slots)[slot + length] = '\0';
        at += length + 1;
    }
}

uint64_t scanTable(const std::string& path)
{
    sqlite3* database = openTable(path, "OFF");
    sqlite3_stmt* select = prepare(database, "SELECT * FROM history");
    std::vector<char> slots(slotSize * 64);
    char text[columns][256];
    uint64_t rows = 0;
    for (; sqlite3_step(select) == SQLITE_ROW; rows++) {
        for (int column = 0; column < namesColumn; column++) {
            if (sqlite3_column_type(select, column) == SQLITE_INTEGER)
                benchmark::DoNotOptimize(sqlite3_column_int64(select, column));
            else
                takeText(select, column, text[column], sizeof text[column]);
        }
        takeNames(select, namesColumn, &slots);
        benchmark::DoNotOptimize(text);
        benchmark::DoNotOptimize(slots.data());
    }
    sqlite3_finalize(select);
    sqlite3_close(database);
    return rows;
}
