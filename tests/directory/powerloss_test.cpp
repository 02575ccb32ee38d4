// Power loss. From the log of all changes and syncs of a run, the states that a disk may hold after
// the power went are built, and every one of them is opened.
//
// The model: what a sync covered is kept. Of the rest, each 512-byte sector may hold any of its
// later contents or none of them, in any combination; length changes of one file, and changes of
// names, reach the disk in their order, as far as they get; a write behind a length change that is
// lost is not seen.
#include "directory/fixture.h"

#include <array>
#include <cstdio>
#include <random>
#include <sys/stat.h>

static constexpr size_t sector = 512;

// A file: what is surely on the disk, and the changes that may be.
struct diskFile {
    std::string durable;
    std::vector<const diskOp*> pending;
};

struct diskModel {
    std::map<ino_t, diskFile> files;
    std::map<std::string, ino_t> names;
    std::vector<const diskOp*> pendingNames;
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

// The file with its first `lengths` pending length changes, and of each written sector what `kept`
// says, which is asked once for each sector of each write.
template <typename choice>
static std::string contentOf(const diskFile& file, size_t lengths, choice kept)
{
    std::string cache = file.durable, content = file.durable;
    for (const diskOp* op : file.pending) {
        const size_t end = op->at + op->bytes.size();
        const bool truncates = op->kind == diskTruncate, resizes = truncates || end > cache.size();
        const bool reaches = !resizes || lengths > 0;
        if (truncates && !reaches)
            break;
        lengths -= resizes && reaches;
        cache.resize(resizes ? end : cache.size());
        content.resize(resizes && reaches ? end : content.size());
        cache.replace(op->at, op->bytes.size(), op->bytes);
        for (size_t at = op->at / sector * sector; at < end; at += sector)
            if (kept() && at < content.size())
                content.replace(at, sector, cache, at, std::min(sector, content.size() - at));
    }
    return content;
}

static void advance(diskModel* model, const diskOp& op, const std::string& ignored)
{
    if (op.kind == diskWrite || op.kind == diskTruncate) {
        model->files[op.inode].pending.push_back(&op);
    } else if (op.kind == diskSync && op.name != ignored) {
        diskFile& file = model->files[op.inode];
        file = {contentOf(file, SIZE_MAX, [] { return true; }), {}};
    } else if (op.kind == diskNames && op.name != ignored) {
        for (const diskOp* change : model->pendingNames)
            applyName(&model->names, *change);
        model->pendingNames.clear();
    } else if (op.kind != diskSync && op.kind != diskNames) {
        model->pendingNames.push_back(&op);
        if (op.kind == diskCreate)
            model->files[op.inode] = {};
    }
}

class PowerLossTest : public DirectoryTest
{
  protected:
    std::mt19937 random{20261122};
    std::set<size_t> opened;
    size_t tried = 0, secondTried = 0, bad = 0;
    bool stopAtBad = false, isSecond = false;
    std::string firstBad, running;
    // Of the run: the disk before it; what was done to it, each with the numbers of entries that
    // may come out just before; the number behind all of it.
    diskModel start;
    std::vector<std::pair<diskOp, std::vector<unsigned int>>> log;
    unsigned int kept = 0;

    PowerLossTest()
    {
        unsetenv("ZQ3SYNC");
    }

    diskModel present()
    {
        diskModel model;
        for (const auto& [name, bytes] : load()) {
            struct stat status;
            EXPECT_EQ(0, stat((directory + name).c_str(), &status));
            model.names[name] = status.st_ino;
            model.files[status.st_ino].durable = bytes;
        }
        return model;
    }

    // Goes on with the run. With stopAt, the process ends there and nothing is acknowledged.
    template <typename use>
    void step(const std::vector<unsigned int>& outcomes, use run, int stopAt = -1)
    {
        EXPECT_EQ(stopAt < 0, watch(run, {stopAt, SIZE_MAX}) >= 0) << running;
        for (const diskOp& op : disk.log)
            log.push_back({op, outcomes});
        if (stopAt < 0)
            kept = static_cast<unsigned int>(
                std::stoul(slurp(historyPath).substr(60, 8), nullptr, 16));
    }

    void tryState(const Files& state, const std::vector<unsigned int>& allowed)
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
        if (!fault.empty() && bad++ == 0)
            firstBad = running + ": " + fault;
        if (!fault.empty() || stopAtBad || isSecond || opened.size() % slowdown != 0)
            return;
        // The power goes again while the state is being opened.
        isSecond = true;
        store(state);
        diskModel model = present();
        watch([this] { return openAndClose(); });
        const std::vector<diskOp> recovery = disk.log;
        for (const diskOp& op : recovery) {
            advance(&model, op, "");
            cutPower(model, allowed, 8);
        }
        isSecond = false;
    }

    // Builds the states of one moment: nothing kept, all kept, each sector alone lost or kept, and
    // at random; with every prefix of the changes of lengths and names.
    void cutPower(const diskModel& model, const std::vector<unsigned int>& allowed,
                  unsigned int tries)
    {
        std::map<std::string, ino_t> names = model.names;
        for (size_t i = 0; i <= model.pendingNames.size(); i++) {
            for (size_t way = 0, sectors = 0; way < 2 * (sectors + 1) + tries; way++) {
                const bool most = way % 2 == 0, isRandom = way >= 2 * (sectors + 1);
                const size_t lone = way / 2 - 1; // the first two ways have none
                const unsigned int share = std::array{10u, 50u, 90u}[random() % 3];
                size_t asked = 0;
                Files state;
                for (const auto& [name, inode] : names) {
                    const size_t lengths = most ? SIZE_MAX : way == 1 ? 0 : random() % 8;
                    state[name] = contentOf(model.files.at(inode), lengths, [&] {
                        const bool isLone = asked++ == lone;
                        return isRandom ? random() % 100 < share : isLone != most;
                    });
                }
                sectors = way == 0 ? asked : sectors;
                tryState(state, allowed);
                if (stopAtBad && bad != 0)
                    return;
            }
            if (i < model.pendingNames.size())
                applyName(&names, *model.pendingNames[i]);
        }
    }

    // The scenario, stopped where told and then opened, with a batch behind it; the power goes
    // behind every operation. Returns the number of the scenario's own.
    int cutOne(const scenario& s, int stopAt, unsigned int tries, const std::string& ignored)
    {
        running = s.action + " on " + s.before + ", stopped at " + std::to_string(stopAt);
        store(filesOf(s.before));
        start = present();
        log.clear();
        step(
            s.outcomes, [&] { return run(s); }, stopAt);
        const size_t operations = log.size();
        // Whichever of the two the open decides for: that it stays so is what counts.
        if (stopAt >= 0)
            step(s.outcomes, [this] { return openAndClose(); });
        step({kept, kept + 1}, [this] { return batch(1); });
        for (size_t i = 0; i <= log.size(); i++) {
            if (stopAt < 0 || i >= operations)
                cutPower(start, i < log.size() ? log[i].second : std::vector{kept}, tries);
            if (i < log.size())
                advance(&start, log[i].first, ignored);
        }
        return static_cast<int>(operations);
    }

    void cutAll(unsigned int tries, const std::string& ignored = "")
    {
        for (const scenario& s : scenarios) {
            // The pieces of a restored image are not ordered against each other.
            if (s.action.starts_with("restore") || (stopAtBad && bad != 0))
                continue;
            const int operations = cutOne(s, -1, tries, ignored);
            const bool stops = s.action == "commit 2";
            for (int at = 0; stops && at < operations && !(stopAtBad && bad != 0); at++)
                cutOne(s, at, tries, ignored);
        }
    }
};

TEST_F(PowerLossTest, EveryStateAfterAPowerLossOpensAsTheOldOrTheNewHistory)
{
    cutAll(48 / slowdown);
    printf("%zu states tried (%zu of them in a recovery), %zu different ones opened, %zu bad\n",
           tried, secondTried, opened.size(), bad);
    EXPECT_EQ(0u, bad) << firstBad;
    EXPECT_GE(tried, 100000u / slowdown);
}

// Each barrier on its own is necessary: without it some state is bad.
TEST_F(PowerLossTest, EveryBarrierTakenOutLosesAHistory)
{
    stopAtBad = true;
    for (const char* barrier : {"B1", "B2", "B3", "B4", "R0", "R4", "CH", "D"}) {
        tried = bad = 0;
        opened.clear();
        cutAll(8, barrier);
        printf("without %s: bad state after %zu states, %s\n", barrier, tried, firstBad.c_str());
        EXPECT_GT(bad, 0u) << barrier;
    }
}
