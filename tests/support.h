// What the tests of the history library share: scratch directories, the diagnostic log as text, and
// entries that are quick to build and to read.
#pragma once

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include <sys/sem.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "history/sqluhist.h"

inline std::string slurp(const std::string& path)
{
    std::ifstream in(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(in), {}};
}

inline void spill(const std::string& path, const std::string& bytes)
{
    std::ofstream(path, std::ios::binary | std::ios::trunc) << bytes;
}

// The semaphore set of an existing file's key; -1 when there is none, -2 when there is no key.
inline int lockSetOf(const std::string& historyPath)
{
    SQLO_NLCK lock = {};
    return sqloNLCKInit(historyPath.c_str(), &lock, sqloNLCKUseNodeNumber) == 0
               ? semget(lock.key, 0, 0)
               : -2;
}

inline bool lockKeyIsFree(const std::string& historyPath)
{
    return lockSetOf(historyPath) == -1;
}

inline void removeLockSet(const std::string& historyPath)
{
    semctl(lockSetOf(historyPath), 0, IPC_RMID);
}

// A scratch directory in memory with a history directory in it whose lock key nobody uses, and a
// diagnostic log of its own. Everything is removed at the end.
class HistoryTest : public testing::Test
{
  protected:
    std::string root, directory, historyPath, shadowPath, logPath;
    std::vector<std::string> namedOperations; // that the records of takeLog name, neighbours once

    HistoryTest()
    {
        setenv("ZQ3SYNC", "off", 1);
        // A key has 16 bits of the inode number. The memory file system numbers inodes one after
        // the other, so the files that the test makes have keys near that of a file made here.
        do {
            std::filesystem::remove_all(root);
            root = access("/dev/shm", W_OK) == 0 ? "/dev/shm/zq3XXXXXX" : "/tmp/zq3XXXXXX";
            root = std::string(mkdtemp(root.data())) + "/";
            directory = root + "SAMPLE/";
            std::filesystem::create_directory(directory);
            historyPath = directory + SQLUH_HISTORY_NAME;
            shadowPath = directory + SQLUH_SHADOW_NAME;
            spill(historyPath, "");
        } while (!lockKeyIsFree(historyPath));
        unlink(historyPath.c_str());
        logPath = root + "diag.log";
        setenv("ZQ3DIAGLOG", logPath.c_str(), 1);
    }

    ~HistoryTest() override
    {
        removeLockSet(historyPath);
        std::filesystem::remove_all(root);
    }

    // The records logged since the last call without time, process and function: the text, then
    // " [LABEL: N bytes]" for each dump. Levels other than Error stand in front; of an
    // administration message only its number is kept. Every record names a public operation, as
    // their names begin.
    std::vector<std::string> takeLog()
    {
        static const std::string admin = "Administration message ";
        std::vector<std::string> records;
        std::ifstream in(logPath);
        namedOperations.clear();
        for (std::string line; std::getline(in, line);) {
            if (!line.starts_with("    ")) {
                size_t level = line.find(" level=") + 7, function = line.find(" function=");
                std::string name = line.substr(level, function - level) + " ";
                size_t end = line.find(':', function);
                std::string text = line.substr(end + 1).erase(0, 1);
                std::string operation = line.substr(function + 10, end - function - 10);
                EXPECT_TRUE(operation.starts_with("sqlu") || operation.starts_with("sqlo")) << line;
                if (namedOperations.empty() || namedOperations.back() != operation)
                    namedOperations.push_back(operation);
                if (text.starts_with(admin))
                    text.erase(admin.size() + 4);
                records.push_back((name == "Error " ? "" : name) + text);
            } else if (line.ends_with(" bytes")) {
                records.back() += " [" + line.substr(4) + "]";
            } else if (!line.ends_with("|") && !line.ends_with(" shown)") &&
                       !records.back().starts_with(admin)) {
                records.back() += " / " + line.substr(4);
            }
        }
        unlink(logPath.c_str());
        return records;
    }

    SQLO_FHANDLE open(unsigned int word = sqloOpenUpdate)
    {
        SQLO_FHANDLE fh = sqloNoFile;
        EXPECT_EQ(0, sqloopenp(historyPath.c_str(), word, sqloPermissions, &fh));
        return fh;
    }

    static long long positionOf(SQLO_FHANDLE fh)
    {
        long long position = -1;
        EXPECT_EQ(0, sqloseek(fh, 0, sqloFromCurrent, &position));
        return position;
    }
};

// An entry to be written: set the members, then take build().
struct entryBuilder {
    std::string objectPart, secondTimestamp, firstText, lastText, idText, qualifier, name, longText,
        note, command;
    std::vector<std::string> tablespaces;
    sqlca ca = {};
    bool withSqlca = false;
    zq3HistoryData data = {};
    SQLUH_ENTRY entry = {};
    std::vector<textBuffer> tablespaceBuffers;

    entryBuilder()
    {
        data.operation = 'B';
        data.object = 'D';
        data.operationType = 'F';
        data.status = 'A';
        data.auxCode = 'x';
        sqloinca(&ca);
    }

    // In the order of the record's buffers.
    std::vector<std::string*> texts()
    {
        return {&objectPart, &secondTimestamp, &firstText, &lastText, &idText, &qualifier,
                &name,       &longText,        &note,      &command};
    }

    // Points the records at the texts and sets the lengths that follow from them.
    SQLUH_ENTRY* build()
    {
        const auto point = [](std::string& text) {
            uint32_t length = static_cast<uint32_t>(text.size());
            return textBuffer{text.data(), length + 1, length};
        };
        textBuffer* buffer = &data.objectPart;
        for (std::string* text : texts())
            *buffer++ = point(*text);
        tablespaceBuffers.clear();
        for (std::string& tablespace : tablespaces)
            tablespaceBuffers.push_back(point(tablespace));
        entry.qualifierLength = data.qualifierText.length;
        entry.nameLength = data.nameText.length;
        entry.longTextLength = data.longText.length;
        entry.noteLength = data.noteText.length;
        entry.commandLength = data.commandText.length;
        entry.sqlcaLength = withSqlca ? 194 : 0;
        data.numTablespaces = static_cast<uint32_t>(tablespaces.size());
        data.tablespaceBuffers = tablespaceBuffers.data();
        data.eventSqlca = &ca;
        entry.data = &data;
        return &entry;
    }
};

// A place for an entry to be read into, every text with a buffer of the given capacity.
struct entryReader {
    std::vector<std::vector<char>> storage;
    std::vector<textBuffer> tablespaceBuffers;
    sqlca ca = {};
    zq3HistoryData data = {};
    SQLUH_ENTRY entry = {};
    SQLUH_WORKAREA workArea = {};
    unsigned int flags = 0;

    explicit entryReader(uint32_t capacity = 4096, uint32_t maxTablespaces = 64,
                         uint32_t workAreaSize = defaultWorkAreaSize)
        : storage(10 + maxTablespaces, std::vector<char>(capacity, '~')),
          tablespaceBuffers(maxTablespaces)
    {
        for (uint32_t i = 0; i < 10 + maxTablespaces; i++)
            (i < 10 ? texts()[i] : tablespaceBuffers[i - 10]) = {storage[i].data(), capacity, 0};
        data.tablespaceBuffers = tablespaceBuffers.data();
        data.maxTablespaces = maxTablespaces;
        data.eventSqlca = &ca;
        entry.data = &data;
        EXPECT_EQ(0, sqluhInitWorkArea(&workArea, workAreaSize));
    }
    entryReader(const entryReader&) = delete;
    ~entryReader()
    {
        sqlofmblkEx(workArea.buffer);
    }

    // The record's ten buffers.
    textBuffer* texts()
    {
        return &data.objectPart;
    }

    int read(SQLO_FHANDLE fh, const char* timestamp = nullptr, const char* qualifier = nullptr,
             const char* name = nullptr, const char* tablespace = nullptr)
    {
        return sqluhReadEntry(fh, &entry, &workArea, timestamp, qualifier, name, tablespace,
                              &flags);
    }
};
