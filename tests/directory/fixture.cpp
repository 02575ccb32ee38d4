// Scenarios and what is done with them.
#include "directory/fixture.h"

#include <algorithm>
#include <sstream>
#include <sys/wait.h>

// Offsets in a header's text of the status letter, and of the end of its fields.
constexpr size_t checksumWidth = 8, statusAt = 132, headerFieldsEnd = 176;

// clang-format off
const std::vector<scenario> scenarios = {
    {"commit 1", " 10/ 10", " 11/C11", {10, 11}},  {"commit 2", " 10/ 10", " 12/C12", {10, 12}},
    {"commit 3", " 10/ 10", " 13/C13", {10, 13}},  {"commit 4", " 10/ 10", " 14/C14", {10, 14}},
    {"commit 5", " 10/ 10", " 15/C15", {10, 15}},  {"commit 6", " 10/ 10", " 16/C16", {10, 16}},
    {"commit 1", " 1/ 1", " 2/C2", {1, 2}},        {"commit 2", " 1/ 1", " 3/C3", {1, 3}},
    {"commit 1", "-/-", " 1/C1/empty", {0, 1}},    {"abandon 0", " 10/ 10", "P10/ 10", {10}},
    {"abandon 1", " 10/ 10", "P10+788/ 10", {10}}, {"restore 2", " 10/ 10", " 12/ 12", {10, 12}},
    {"open", " 10/ 10", " 10/ 10", {10}},          {"open", " 10/C10", " 10/C10", {10}},
    {"open", " 10/-", " 10/ 10", {10}},            {"open", " 10/junk", " 10/ 10", {10}},
    {"open", " 10/P10", " 10/ 10", {10}},          {"open", " 10/Q12", " 10/ 10", {10}},
    {"open", " 10/ 10-1", " 10/ 10", {10}},        {"open", "C12/ 10", " 12/C12", {12}},
    {"open", "C12/C12", " 12/C12", {12}},          {"open", "C12/C12-876", " 12/C12", {12}},
    {"open", "C12/P10", " 12/C12", {12}},          {"open", "C12/-", " 12/C12", {12}},
    {"open", "C12/junk", " 12/C12", {12}},         {"open", "P10+900/ 10", " 10/P10", {10}},
    {"open", "P12/C10", " 10/P10", {10}},          {"open", "P12/P10", " 10/P10", {10}},
    {"open", "Q12/ 10", " 10/P10", {10}},          {"open", "junk/C12", " 12/P12", {12}},
    {"open", "empty/P10", " 10/P10", {10}},        {"open", "-/ 10", " 10/P10", {10}},
    {"fatal", "-/-", " 0/ 0/empty", {0}},          {"fatal", "junk/Q10", " 0/ 0/junk/Q10", {0}},
    {"fatal", "P10/-", " 0/ 0/P10", {0}},          {"fatal", "-/junk", " 0/ 0/empty/junk", {0}},
};
// clang-format on

std::vector<std::string> DirectoryTest::samples;

DirectoryTest::DirectoryTest()
{
    // Keys hold 16 bits of the inode number, and these tests make many files: test programs that
    // run side by side take different node numbers, which are in the key, too.
    sqlz_krcbp->nodeNumber = static_cast<int16_t>(getpid() % 240);
    setenv("ZQ3DIAGLOG", "/dev/null", 1);
    onCall = nullptr;
    disk = {};
    while (samples.size() <= 17) {
        EXPECT_EQ(0, samples.empty() ? sqluhCreate(directory.data()) : batch(1));
        samples.push_back(slurp(historyPath));
        EXPECT_EQ(1024 + 788 * (samples.size() - 1), samples.back().size());
    }
    store({});
}

Files DirectoryTest::load()
{
    Files files;
    for (const auto& file : std::filesystem::directory_iterator(directory))
        files[file.path().filename()] = slurp(file.path());
    return files;
}

// Files that exist keep their inodes, so that a directory has few lock keys over its life.
void DirectoryTest::store(const Files& files)
{
    for (const auto& file : std::filesystem::directory_iterator(directory))
        if (!files.contains(file.path().filename()))
            std::filesystem::remove(file.path());
    for (const auto& [name, bytes] : files)
        spill(directory + name, bytes);
}

// "C12": a history of 12 entries with status C; "C12-876": the same without its last 876 bytes;
// "P10+900": with 900 bytes of the entries that would come next; "-": no file.
std::string DirectoryTest::fileOf(const std::string& word)
{
    char status = 0;
    unsigned int entries = 0;
    int more = 0;
    if (sscanf(word.c_str(), "%c%u%d", &status, &entries, &more) < 2)
        return word == "junk" ? std::string(3000, 'x') : "";
    std::string path = root + "word";
    spill(path, samples.at(entries));
    EXPECT_EQ(0, sqluhUpdateHeaderStatus(path.data(), status));
    const size_t length = samples.at(entries).size();
    return (slurp(path) + samples.at(entries + 2 * (more > 0)).substr(length))
        .substr(0, length + static_cast<size_t>(more));
}

Files DirectoryTest::filesOf(const std::string& words)
{
    const char* names[] = {SQLUH_HISTORY_NAME, SQLUH_SHADOW_NAME, SQLUH_SAVED_HISTORY_NAME,
                           SQLUH_SAVED_SHADOW_NAME};
    Files files;
    std::istringstream list(words);
    std::string word;
    for (size_t i = 0; std::getline(list, word, '/'); i++)
        if (word != "-")
            files[names[i]] = fileOf(word);
    return files;
}

std::string DirectoryTest::settledForm(std::string image)
{
    if (image.size() >= headerLength) {
        std::fill_n(image.begin(), checksumWidth, image[statusAt] = '-');
        // Only blanks stand behind a header's fields. A copy stopped in the head leaves zeros there
        image.erase(headerFieldsEnd, headerLength - headerFieldsEnd);
    }
    return image;
}

int DirectoryTest::append(SQLUH_HANDLE* handle, unsigned int entries)
{
    int rc = sqloseek(handle->fileHandle, 0, sqloFromEnd, nullptr);
    for (unsigned int i = 0; rc == 0 && i < entries; i++) {
        entryBuilder builder;
        builder.data.entryNumber = handle->header.entryCount + 1;
        builder.data.entryNode = writer;
        builder.note = "entry " + std::to_string(builder.data.entryNumber);
        builder.tablespaces = {"USERDATA01"};
        rc = sqluhWriteEntry(handle, builder.build());
        if (rc == 0)
            handle->header.entryCount++;
    }
    return rc;
}

int DirectoryTest::batch(unsigned int entries, unsigned int flags)
{
    SQLUH_HANDLE* handle = nullptr;
    disk.batchSyncs = 0;
    phase = "begin";
    int rc = sqluhBeginBatch(&handle, directory.data());
    phase = "commit";
    EXPECT_EQ(rc != 0, handle == nullptr);
    if (rc == 0)
        rc = append(handle, entries);
    // A batch that could not be written is given up.
    const int ended = sqluhEndBatch(&handle, rc == 0 ? flags : unsigned{sqluhAbandon});
    EXPECT_EQ(nullptr, handle);
    phase = "";
    return rc != 0 ? rc : ended;
}

int DirectoryTest::openAndClose()
{
    SQLUH_HANDLE* handle = nullptr;
    const int rc = sqluhOpen(&handle, directory.data(), SQLUH_OPEN_READ);
    EXPECT_EQ(rc < 0, handle == nullptr);
    const int closed = sqluhClose(&handle);
    return rc < 0 ? rc : closed != 0 ? closed : rc;
}

int DirectoryTest::run(const scenario& s)
{
    const unsigned int writes = static_cast<unsigned int>(s.action.back() - '0');
    if (s.action == "open" || s.action == "fatal")
        return openAndClose();
    if (!s.action.starts_with("restore"))
        return batch(writes, s.action[0] == 'c' ? sqluhCommit : sqluhAbandon);
    std::string image = samples.at(s.outcomes.back());
    SQLUH_HANDLE* handle = nullptr;
    int rc = sqluhOpen(&handle, directory.data(), SQLUH_OPEN_UPDATE);
    for (unsigned int at = 0, length = 2500; rc == 0 && at < image.size(); at += length)
        rc = sqluh_write_restore_buffer(
            handle, at, reinterpret_cast<unsigned char*>(&image[at]),
            std::min(length, static_cast<unsigned int>(image.size()) - at));
    const int closed = sqluhClose(&handle);
    return rc != 0 ? rc : closed;
}

std::string DirectoryTest::faultOf(const std::vector<unsigned int>& outcomes)
{
    for (int i = 0; i < 2; i++) {
        const int rc = openAndClose();
        if (rc < 0)
            return "open returns " + std::to_string(rc);
    }
    const std::string history = slurp(historyPath), form = settledForm(history);
    if (std::ranges::none_of(outcomes,
                             [&](unsigned int n) { return form == settledForm(samples[n]); }))
        return "neither old nor new: " + std::to_string(history.size()) + " bytes";
    if (settledForm(slurp(shadowPath)) != form)
        return "the files differ";
    return history[statusAt] != ' ' || !lockKeyIsFree(historyPath) ? "not blank, or locked" : "";
}

bool DirectoryTest::isPartOfRestore(const scenario& s)
{
    const std::string form = settledForm(slurp(historyPath));
    return s.action.starts_with("restore") && form.size() >= headerFieldsEnd &&
           (settledForm(samples.at(s.outcomes.back())).starts_with(form) ||
            form == settledForm(samples.at(0)));
}

SQLO_NLCKSTATE DirectoryTest::lockState(SQLO_NLCK* lock)
{
    SQLO_NLCKSTATE state = {};
    if (sqloNLCKInit(historyPath.c_str(), lock, sqloNLCKUseNodeNumber) == 0) {
        EXPECT_EQ(0, sqloNLCKQuery(lock, &state));
    }
    return state;
}

int DirectoryTest::removeSetsOf(pid_t pid)
{
    struct seminfo info;
    int removed = 0;
    const int last = semctl(0, 0, SEM_INFO, &info);
    for (int index = 0; index <= last; index++) {
        struct semid_ds set;
        const int id = semctl(index, 0, SEM_STAT, &set);
        if (id >= 0 && semctl(id, 0, GETPID) == pid)
            removed += semctl(id, 0, IPC_RMID) == 0;
    }
    return removed;
}

int waitFor(pid_t child)
{
    int status = -1;
    return waitpid(child, &status, 0) == child ? status : -1;
}
