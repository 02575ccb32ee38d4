// Power loss. From the log of all changes and syncs of a run, the states that a disk may hold after
// the power went are built, and every one of them is opened.
//
// The model: what a sync covered is kept. Of the rest, each 512-byte sector may hold any of its
// later contents or none of them, in any combination; length changes of one file, and changes of
// names, reach the disk in their order, as far as they get; a write past a length change that is
// lost is not seen.
#include "directory/fixture.h"

#include <array>
#include <random>

static constexpr size_t sector = 512;
// Of the states opened, one in so many loses the power once more.
static const size_t share = takesAll ? 1 : 16 * slowdown;

struct diskFile {
    std::string bytes; // what is surely on the disk, and the mark
    bool marked = false;
    std::vector<diskOp> pending = {};
};

struct diskModel {
    std::map<ino_t, diskFile> files;
    std::map<std::string, ino_t> names;
    std::vector<diskOp> pendingNames;
};

static void applyName(std::map<std::string, ino_t>* names, const diskOp& op)
{
    if (op.kind == diskRename)
        (*names)[op.newName] = (*names)[op.name];
    if (op.kind == diskCreate)
        (*names)[op.name] = op.inode;
    else
        names->erase(op.name);
}

// What reaches the disk: all sectors or none, but for one; or each with some chance.
struct choice {
    bool most = true;
    size_t lone = SIZE_MAX; // number of the sector that is the exception
    unsigned int share = 0; // chance in percent; 0: not at random
    std::mt19937* random = nullptr;
    size_t asked = 0;

    bool keeps()
    {
        const bool isLone = asked++ == lone;
        return share == 0 ? isLone != most : (*random)() % 100 < share;
    }
    std::string told() const
    {
        return share != 0 ? "sectors kept at random"
               : lone == SIZE_MAX
                   ? (most ? "all kept" : "all lost")
                   : (most ? "all kept but the sector " : "all lost but the sector ") +
                         std::to_string(lone);
    }
};

// The file with its first `lengths` pending length changes, and of the sectors that a pending write
// touched those that are kept. A mode is kept or lost like a sector.
static diskFile contentOf(const diskFile& onDisk, size_t lengths, choice* kept)
{
    diskFile file = {onDisk.bytes, onDisk.marked};
    std::string cache = file.bytes, &content = file.bytes;
    for (const diskOp& op : onDisk.pending) {
        if (op.kind == diskMode) {
            file.marked = kept->keeps() ? op.at != 0 : file.marked;
            continue;
        }
        const size_t end = op.at + op.bytes.size();
        if (op.kind == diskTruncate || end > cache.size()) {
            if (op.kind == diskTruncate && lengths == 0)
                break;
            cache.resize(end);
            content.resize(lengths > 0 ? end : content.size());
            lengths -= lengths > 0;
        }
        cache.replace(op.at, op.bytes.size(), op.bytes);
        for (size_t at = op.at / sector * sector; at < end; at += sector)
            if (kept->keeps() && at < content.size())
                content.replace(at, sector, cache, at, std::min(sector, content.size() - at));
    }
    return file;
}

class PowerLossTest : public DirectoryTest
{
  protected:
    std::mt19937 random{20261122};
    std::set<size_t> opened;
    size_t tried = 0, secondTried = 0;
    bool isSecond = false;
    std::string ignored; // the barrier taken out
    std::string running; // the scenario and the moment
    std::string bad;     // the first bad state, in words

    PowerLossTest()
    {
        unsetenv("ZQ3SYNC");
    }

    diskModel present()
    {
        diskModel model;
        for (const auto& [name, bytes] : load()) {
            struct stat status;
            const std::string plain = name.substr(0, name.find('*'));
            EXPECT_EQ(0, stat((directory + plain).c_str(), &status));
            model.names[plain] = status.st_ino;
            model.files[status.st_ino] = {bytes, name.ends_with('*')};
        }
        return model;
    }

    // What the sync covers is durable; the mode is only where it says so.
    static void sync(diskFile* file, const diskOp& op)
    {
        choice all;
        const diskFile synced = contentOf(*file, SIZE_MAX, &all);
        file->bytes = synced.bytes;
        file->marked = op.at != 0 ? synced.marked : file->marked;
        std::erase_if(file->pending,
                      [&](const diskOp& kept) { return op.at != 0 || kept.kind != diskMode; });
    }

    void advance(diskModel* model, const diskOp& op)
    {
        const auto file = model->files.find(op.inode);
        if (op.kind == diskNames && op.barrier != ignored) {
            for (const diskOp& change : model->pendingNames)
                applyName(&model->names, change);
            model->pendingNames.clear();
        } else if (op.kind == diskCreate || op.kind == diskUnlink || op.kind == diskRename) {
            model->pendingNames.push_back(op);
            if (op.kind == diskCreate)
                model->files[op.inode] = {};
        } else if (file != model->files.end() && op.kind != diskSync) {
            file->second.pending.push_back(op);
        } else if (file != model->files.end() && op.barrier != ignored) {
            sync(&file->second, op);
        } // or a file in another directory
    }

    // The log for the power: a write that waits may still be lost while it does.
    static std::vector<diskOp> parted(const std::vector<diskOp>& log)
    {
        std::vector<diskOp> all;
        for (const diskOp& op : log) {
            all.push_back(op);
            if (op.kind != diskWrite || op.barrier.empty())
                continue;
            all.back().barrier.clear();
            all.push_back({diskSync, op.inode, 0, "", op.name, "", op.barrier});
        }
        return all;
    }

    void tryState(const Files& state, const choice& kept, const std::vector<unsigned int>& allowed)
    {
        std::string all = std::to_string(100 * allowed.front() + allowed.back());
        for (const auto& [name, bytes] : state)
            all.append(name).append(bytes);
        tried++;
        secondTried += isSecond;
        if (!opened.insert(std::hash<std::string>()(all)).second)
            return;
        store(state);
        const std::string fault = faultOf(allowed);
        if (!fault.empty())
            bad = running + ", " + kept.told() + ": " + fault;
        else if (ignored.empty() && !isSecond && opened.size() % share == 0)
            cutRecovery(state, allowed);
    }

    // The power goes again while the state is being opened.
    void cutRecovery(const Files& state, const std::vector<unsigned int>& allowed)
    {
        isSecond = true;
        store(state);
        diskModel model = present();
        watch([this] { return openAndClose(); });
        const std::vector<diskOp> recovery = parted(disk.log);
        const std::string first = running;
        for (size_t i = 0; i < recovery.size(); i++) {
            advance(&model, recovery[i]);
            running = first + "; its recovery " + momentOf(recovery, i + 1);
            cutPower(model, allowed, 8);
        }
        running = first;
        isSecond = false;
    }

    // Builds the states of one moment, with every prefix of the changes of names, and ends at the
    // first bad one.
    void cutPower(const diskModel& model, const std::vector<unsigned int>& allowed,
                  unsigned int tries)
    {
        std::map<std::string, ino_t> names = model.names;
        for (size_t i = 0; i <= model.pendingNames.size(); i++) {
            cutUnderNames(model, names, allowed, tries);
            if (i < model.pendingNames.size())
                applyName(&names, model.pendingNames[i]);
        }
    }

    // Nothing kept, all kept, each sector alone lost or kept, and some at random.
    void cutUnderNames(const diskModel& model, const std::map<std::string, ino_t>& names,
                       const std::vector<unsigned int>& allowed, unsigned int tries)
    {
        for (size_t way = 0, sectors = 0; bad.empty() && way < 2 * (sectors + 1) + tries; way++) {
            choice kept = {way % 2 == 0, way / 2 - 1}; // the first two ways have no exception
            if (way >= 2 * (sectors + 1))
                kept = {kept.most, SIZE_MAX, std::array{10u, 50u, 90u}[random() % 3], &random};
            Files state;
            for (const auto& [name, inode] : names) {
                const size_t lengths = kept.most ? SIZE_MAX : way == 1 ? 0 : random() % 8;
                const diskFile file = contentOf(model.files.at(inode), lengths, &kept);
                state[name + (file.marked ? "*" : "")] = file.bytes;
            }
            sectors = way == 0 ? kept.asked : sectors;
            tryState(state, kept, allowed);
        }
    }

    // The scenario, stopped where told and then opened, with a batch after it; the power goes after
    // every operation. Returns the number of the scenario's own.
    int cutOne(const scenario& s, int stopAt, unsigned int tries)
    {
        store(filesOf(s.before));
        diskModel model = present();
        std::vector<diskOp> log;
        const auto step = [&](auto use, int stop = -1) {
            EXPECT_EQ(stop < 0, watch(use, {stop, SIZE_MAX}) >= 0 && !disk.stopped)
                << s.action << " on " << s.before;
            const std::vector<diskOp> made = parted(disk.log);
            log.insert(log.end(), made.begin(), made.end());
            return static_cast<int>(disk.log.size());
        };
        const int calls = step([&] { return run(s); }, stopAt);
        const size_t operations = log.size();
        // Whichever of the two the open decides for: that it stays so is what counts.
        if (stopAt >= 0)
            step([this] { return openAndClose(); });
        const size_t settled = log.size();
        const unsigned int kept = stopAt < 0 ? s.outcomes.back() : idOf(slurp(historyPath));
        step([this] { return batch(1); });
        for (size_t i = 0; i <= log.size(); i++) {
            running = s.action + " on " + s.before + ", stopped at " + std::to_string(stopAt) +
                      ", power lost " + momentOf(log, i);
            const auto later = i < log.size() ? std::vector{kept, kept + 1} : std::vector{kept + 1};
            if (stopAt < 0 || i >= operations)
                cutPower(model, i < settled ? s.outcomes : later, tries);
            if (i < log.size())
                advance(&model, log[i]);
        }
        return calls;
    }

    // The scenarios, or those of the action, up to the first bad state.
    void cutAll(unsigned int tries, const std::string& action = "")
    {
        for (const scenario& s : scenarios) {
            const bool isDue = bad.empty() && s.action.starts_with(action);
            const int calls = isDue ? cutOne(s, -1, tries) : 0;
            for (int at = 0; at < calls && bad.empty(); at++)
                cutOne(s, at, tries / 4);
        }
    }
};

TEST_F(PowerLossTest, EveryStateAfterAPowerLossOpensAsTheOldOrTheNewHistory)
{
    cutAll(48 / slowdown);
    printf("%zu states tried (%zu of them in a recovery), %zu different ones opened\n", tried,
           secondTried, opened.size());
    EXPECT_EQ("", bad);
    EXPECT_GE(tried, 100000u / slowdown);
}

// Each barrier and each safeguard on its own is necessary: without it some state is bad.
TEST_F(PowerLossTest, EverySafeguardTakenOutLosesAHistory)
{
    const std::pair<const char*, const char*> rows[] = {
        {"B1", "commit"}, {"B2", "commit"},     {"B3", "commit"},   {"B4", "commit"},
        {"R0", "commit"}, {"R4", "commit"},     {"CH", "commit"},   {"D", "create"},
        {"RP", "copy"},   {"MB", "restore"},    {"MZ", "restore"},  {"MM", "restore"},
        {"N", "create"},  {"one call", "open"}, {"mark", "restore"}};
    for (const auto& [safeguard, action] : rows) {
        ignored = without = safeguard;
        tried = 0;
        bad.clear();
        opened.clear();
        cutAll(8, action);
        printf("without %s: bad state after %zu states, %s\n", safeguard, tried, bad.c_str());
        EXPECT_NE("", bad) << safeguard;
    }
}
