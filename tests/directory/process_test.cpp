// The named lock on real semaphores, several processes on one directory, processes that are killed.
#include "directory/fixture.h"

#include <atomic>
#include <csignal>
#include <fcntl.h>
#include <linux/magic.h>
#include <random>
#include <sys/mman.h>
#include <thread>

// What the system makes of any path: two may have one key, and of one path in some thousands of
// millions it makes that which nobody shares. -1: what it really makes.
static key_t onlyKey = -1;

extern "C" key_t ftok(const char* path, int project) noexcept
{
    static const auto real = realOf(&ftok, "ftok");
    return onlyKey != -1 ? onlyKey : real(path, project);
}

// The clock in seconds before the system's, and sleeps of a millisecond that take no time.
static time_t ahead = 0;
static unsigned int shortSleeps = 0;

extern "C" time_t time(time_t* result) noexcept
{
    static const auto real = realOf(&time, "time");
    const time_t now = real(nullptr) + ahead;
    return result != nullptr ? *result = now : now;
}

extern "C" int usleep(useconds_t duration)
{
    static const auto real = realOf(&usleep, "usleep");
    if (duration != 1000 || shortSleeps == 0)
        return real(duration);
    shortSleeps--;
    return 0;
}

class ProcessTest : public DirectoryTest
{
  protected:
    void useLockOnly()
    {
        store(filesOf("empty"));
        lockState();
    }

    // Of each entry of the history the node number that its writer gave it. Both files are sound
    // and agree, the entries are numbered from 1 on, and as many as the header says.
    std::vector<size_t> writers()
    {
        entryReader reader;
        EXPECT_EQ(0, sqluhVerifyUnopenedHistoryFile(historyPath.data(), &reader.workArea));
        const std::string image = slurp(historyPath);
        EXPECT_TRUE(settledForm(image) == settledForm(slurp(shadowPath)));
        std::vector<size_t> found;
        for (size_t at = 1024; at < image.size(); at += 788) {
            found.push_back(std::stoul(image.substr(at + 9, 4), nullptr, 16));
            EXPECT_EQ(found.size(), std::stoul(image.substr(at + 14, 8), nullptr, 16));
        }
        EXPECT_EQ(found.size(), std::stoul(image.substr(60, 8), nullptr, 16));
        return found;
    }

    // A restore of two entries over ten, with something done by another process between the
    // creation of the new file and its lock.
    template <typename use> int restoreMeeting(use other)
    {
        store(filesOf(" 10/ 10"));
        EXPECT_EQ(0, sqluhOpen(&mine, directory.data(), SQLUH_OPEN_UPDATE));
        bool entered = false;
        onCall = [&](const std::string& call, int) {
            if (call == "semget" && !std::exchange(entered, true))
                other();
            return 0;
        };
        const int rc = restore(mine, samples.at(2));
        onCall = nullptr;
        EXPECT_TRUE(entered);
        return rc;
    }
};

using LockTest = ProcessTest;

// A call of the protocol that fails once: for the creator of the set or, held meaning that the lock
// is taken, for one that comes later; then every take is interrupted.
TEST_F(LockTest, EveryErrorOfEveryCallEndsAsItShould)
{
    const struct {
        bool held;
        const char* call;
        int command;
        std::vector<int> errors;
        int code = 0; // 0: the error itself
    } rows[] = {
        {false, "semget", IPC_CREAT | IPC_EXCL | 0747, {ENOSPC}},
        {false, "semctl", SETVAL, {EINVAL}},
        {false, "semop", -1, {ENOSPC}},
        {false, "semctl", IPC_STAT, {EINVAL}},
        {false, "semctl", IPC_SET, {EPERM}},
        {true, "semget", 0, {EINVAL}},
        {true, "semctl", IPC_STAT, {EFAULT}},
        {true, "semop", -1, {EFBIG}},
        {true, "semget", 0, {EACCES}, sqloNLCKKeyConflict},
        {true, "semctl", IPC_STAT, {EACCES}, sqloNLCKKeyConflict},
        // Vanished or interrupted: once more.
        {true, "semget", 0, {ENOENT}, sqloNLCKBusy},
        {true, "semctl", IPC_STAT, {EINVAL, EIDRM}, sqloNLCKBusy},
        {true, "semop", -1, {EINVAL, EIDRM, EINTR}, sqloNLCKBusy},
    };
    useLockOnly();
    for (const auto& row : rows)
        for (const int error : row.errors) {
            SCOPED_TRACE(testing::Message() << row.call << " " << row.command << " " << error);
            EXPECT_EQ(sqloNLCKAbsent, lockState().state);
            SQLO_NLCK holder = lock;
            EXPECT_EQ(0, row.held ? sqloNLCKLock(&holder, 0, 0) : 0);
            int times = 0;
            onCall = [&](const std::string& call, int command) {
                return call == row.call && command == row.command && times++ == 0 ? error : 0;
            };
            EXPECT_EQ(row.code != 0 ? row.code : sqloSystemError | error,
                      sqloNLCKLock(&lock, 0, 0));
            failCall("semop", -1, EINTR);
            EXPECT_EQ(row.held ? sqloNLCKInterrupted : sqloSystemError | EINTR,
                      sqloNLCKLock(&lock, sqloNLCKReportInterrupts, -1));
            onCall = nullptr;
            // A set that could not be set up is removed; one of somebody else's stays.
            EXPECT_EQ(row.held ? sqloNLCKHeld : sqloNLCKAbsent, lockState().state);
            EXPECT_EQ(row.held ? 0 : sqloSystemError | EINVAL, sqloNLCKUnlock(&holder));
        }
}

TEST_F(LockTest, KeysAreMadeOfFileAndProject)
{
    useLockOnly();
    EXPECT_EQ(ftok(historyPath.c_str(), sqlz_krcbp->nodeNumber + 1), lock.key);
    EXPECT_EQ(0, sqloNLCKInit(historyPath.c_str(), &lock, 0));
    EXPECT_EQ(ftok(historyPath.c_str(), 'n'), lock.key);
    EXPECT_EQ(sqloNLCKKeyFailure, sqloNLCKInit(shadowPath.c_str(), &lock, 0));
    onlyKey = IPC_PRIVATE;
    EXPECT_EQ(sqloNLCKKeyFailure, sqloNLCKInit(historyPath.c_str(), &lock, 0));
    onlyKey = -1;
}

TEST_F(LockTest, ForeignSetsAreLeftAlone)
{
    useLockOnly();
    for (const int mode : {0600, 0757, 0777, 0740}) {
        const int id = semget(lock.key, 1, IPC_CREAT | IPC_EXCL | mode);
        const SQLO_NLCKSTATE state = lockState();
        EXPECT_EQ(sqloNLCKForeign, state.state) << std::oct << mode;
        EXPECT_EQ(sqloNLCKKeyConflict, openAndClose()) << std::oct << mode;
        EXPECT_EQ(sqloNLCKBusy, sqloNLCKRemoveDead(&lock, &state));
        EXPECT_EQ(0, semctl(id, 0, IPC_RMID));
    }
}

// What each call of somebody who only looks may say, and what it is taken for.
TEST_F(LockTest, WhoLooksIsToldWhatTheSystemSays)
{
    const struct {
        const char* call;
        int command;
        std::vector<int> errors;
        int rc, state; // -1: the error
    } rows[] = {{"semget", 0, {EACCES, EPERM}, 0, sqloNLCKForeign},
                {"semget", 0, {ENOENT}, 0, sqloNLCKAbsent},
                {"semget", 0, {EFAULT}, -1, sqloNLCKAbsent},
                {"semctl", IPC_STAT, {EACCES}, 0, sqloNLCKForeign},
                {"semctl", GETVAL, {EIDRM}, 0, sqloNLCKAbsent},
                {"semctl", GETPID, {EINVAL}, 0, sqloNLCKAbsent},
                {"semctl", IPC_STAT, {EFAULT}, -1, sqloNLCKAbsent}};
    useLockOnly();
    SQLO_NLCK holder = lock;
    ASSERT_EQ(0, sqloNLCKLock(&holder, 0, 0));
    for (const auto& row : rows)
        for (const int error : row.errors) {
            SCOPED_TRACE(testing::Message() << row.call << " " << row.command << " " << error);
            SQLO_NLCKSTATE state = {};
            failCall(row.call, row.command, error);
            EXPECT_EQ(row.rc == 0 ? 0 : sqloSystemError | error, sqloNLCKQuery(&lock, &state));
            onCall = nullptr;
            EXPECT_EQ(row.state, state.state);
        }
    failCall("semctl", SEM_INFO, EPERM);
    int index = 0;
    SQLO_NLCKSTATE state = {};
    EXPECT_EQ(sqloSystemError | EPERM, sqloNLCKNext(&index, &lock, &state));
    // The dead holder's set that goes by itself, or that this user may not remove.
    ahead = 100000;
    state = lockState();
    for (const int error : {EPERM, EIDRM}) {
        failCall("semctl", IPC_RMID, error);
        EXPECT_EQ(error == EIDRM ? 0 : sqloSystemError | error, sqloNLCKRemoveDead(&lock, &state));
    }
    // Nor does it change anything when the semaphore cannot be given back.
    ahead = 0;
    EXPECT_EQ(0, semctl(holder.id, 0, SETVAL, 1));
    failCall("semop", 1, EINVAL);
    EXPECT_EQ(sqloNLCKOwnerDied, sqloNLCKLock(&lock, 0, -1));
    onCall = nullptr;
    EXPECT_EQ(0, sqloNLCKUnlock(&holder));
}

// More locks than the table of held ones has places; a file that cannot be kept locked.
TEST_F(LockTest, ALockIsHeldAlsoWithoutItsPlaceInTheTable)
{
    useLockOnly();
    std::vector<SQLO_NLCK> all(100, lock);
    size_t told = 0;
    for (size_t i = 0; i < all.size(); i++) {
        all[i].key = lock.key ^ static_cast<int32_t>(0x400000 + (i << 8));
        ASSERT_EQ(0, sqloNLCKLock(&all[i], 0, 0));
        sqloNLCKKeepFile(&all[i], i % 2 == 0 ? historyPath.c_str() : shadowPath.c_str());
        told += sqloNLCKCheckDeadlock(&all[i]) == sqloNLCKDeadlock;
    }
    EXPECT_TRUE(told != 0 && told < all.size()) << told;
    // The places of those that somebody takes away are used again.
    for (size_t i = 0; i < all.size(); i++) {
        EXPECT_EQ(0, sqloNLCKCheckHeld(&all[i]));
        EXPECT_EQ(0, i % 2 == 0 ? sqloNLCKUnlock(&all[i]) : semctl(all[i].id, 0, IPC_RMID));
    }
    for (SQLO_NLCK& again : all) {
        ASSERT_EQ(0, sqloNLCKLock(&again, 0, 0));
        told -= sqloNLCKCheckDeadlock(&again) == sqloNLCKDeadlock;
    }
    EXPECT_EQ(0u, told);
    for (SQLO_NLCK& held : all)
        EXPECT_EQ(0, sqloNLCKUnlock(&held));
    struct flock whole = {};
    whole.l_type = F_WRLCK;
    const int file = ::open(historyPath.c_str(), O_RDWR);
    EXPECT_EQ(0, fcntl(file, F_OFD_SETLK, &whole)); // nobody keeps it
    SQLO_NLCK holder = lock;
    EXPECT_EQ(0, sqloNLCKLock(&holder, 0, 0));
    sqloNLCKKeepFile(&holder, historyPath.c_str());
    EXPECT_EQ(0, sqloNLCKUnlock(&holder));
    EXPECT_EQ(0, ::close(file));
}

// Others wait for the ready bit, and the query tells what has happened.
TEST_F(LockTest, ACreatorThatDiesInTheSetupIsRecognised)
{
    useLockOnly();
    setenv("ZQ3DIAGLOG", logPath.c_str(), 1);
    for (const int step : {SETVAL, -1, IPC_STAT, IPC_SET}) {
        const pid_t creator = inChild([&] {
            onCall = [&](const std::string& call, int command) {
                return command == step && call != "semget" ? _exit(77), 0 : 0;
            };
            return sqloNLCKLock(&lock, 0, -1);
        });
        siginfo_t info; // it stays as a zombie
        EXPECT_EQ(0, waitid(P_PID, static_cast<id_t>(creator), &info, WEXITED | WNOWAIT));
        EXPECT_EQ(77, info.si_status);
        SQLO_NLCKSTATE state = lockState();
        // Whoever wants the lock meanwhile waits, says so once after some seconds of polls, and
        // gets it when the set is gone.
        shortSleeps = step == SETVAL ? 20000 : 0;
        const pid_t waiter =
            inChild([&] { return sqloNLCKLock(&lock, 0, 0) != 0 || sqloNLCKUnlock(&lock) != 0; });
        shortSleeps = 0;
        if (step == SETVAL) {
            // No operation yet, so no pid: only the set's age tells.
            EXPECT_EQ(sqloNLCKSettingUp, state.state);
            EXPECT_EQ(sqloNLCKBusy, sqloNLCKRemoveDead(&lock, &state));
            ahead = 10;
            state = lockState();
            for (int i = 0; i < 100000 && !std::filesystem::exists(logPath); i++)
                usleep(100);
        }
        EXPECT_EQ(sqloNLCKSetupDied, state.state) << step;
        EXPECT_EQ(step == SETVAL ? 0 : creator, state.pid) << step;
        usleep(5000);
        EXPECT_EQ(0, waitpid(waiter, nullptr, WNOHANG));
        EXPECT_EQ(0, sqloNLCKRemoveDead(&lock, &state));
        semctl(state.id, 0, IPC_RMID); // not to wait for ever
        EXPECT_EQ(0, waitFor(waiter));
        EXPECT_EQ(step == SETVAL ? 1u : 0u, takeLog().size());
        ahead = 0;
        waitFor(creator);
    }
}

// A process that began after the set's last operation only has the number of the one that made it;
// one that keeps the file locked lives whatever its semaphore says.
TEST_F(LockTest, AReusedProcessNumberIsNoHolder)
{
    for (const bool keeps : {false, true}) {
        useLockOnly();
        ASSERT_EQ(0, sqloNLCKLock(&lock, 0, 0));
        if (keeps)
            sqloNLCKKeepFile(&lock, historyPath.c_str());
        EXPECT_EQ(sqloNLCKHeld, lockState().state);
        ahead = 100000; // so much later this process seems to have begun
        const SQLO_NLCKSTATE state = lockState();
        EXPECT_EQ(keeps ? sqloNLCKFaked : sqloNLCKStale, state.state);
        EXPECT_EQ(keeps ? sqloNLCKBusy : 0, sqloNLCKRemoveDead(&lock, &state));
        ahead = 0;
        EXPECT_EQ(keeps ? 0 : sqloSystemError | EINVAL, sqloNLCKUnlock(&lock));
    }
}

// A child that commits without end is killed; what it has been told is committed stays.
TEST_F(ProcessTest, NothingAcknowledgedIsLostByKills)
{
    const unsigned int kills = 1000 / slowdown, killsPerHistory = 25;
    auto* acknowledged = static_cast<std::atomic<size_t>*>(
        mmap(nullptr, 4096, PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0));
    std::mt19937 random{20261122};
    std::map<int, unsigned int> found; // states of the lock
    size_t committed = 0, unacknowledged = 0;
    useconds_t longest =
        2500; // that a child lives; longer where it has not come far enough by then
    for (unsigned int i = 0; i < kills; i++) {
        if (i % killsPerHistory == 0) {
            store(filesOf(" 10/ 10"));
            *acknowledged = 10;
        }
        const size_t before = *acknowledged;
        const pid_t child = inChild([&] {
            for (unsigned int entries = 1; true; entries = entries % 3 + 1)
                *acknowledged += batch(entries) == 0 ? entries : 0;
            return 0;
        });
        usleep(static_cast<useconds_t>(200 + random() % longest));
        kill(child, SIGKILL);
        waitFor(child);
        // While a set is set up only time would tell, but here it is known that nobody lives.
        const SQLO_NLCKSTATE state = lockState();
        EXPECT_EQ(state.state != sqloNLCKAbsent, semctl(state.id, 0, IPC_RMID) == 0);
        found[state.state]++;
        if (state.state == sqloNLCKAbsent && *acknowledged == before)
            longest += longest / 16;
        ASSERT_EQ(0, openAndClose());
        ASSERT_EQ(0, openAndClose());
        const size_t entries = writers().size();
        ASSERT_GE(entries, *acknowledged) << "kill " << i;
        ASSERT_LE(entries, *acknowledged + 3) << "kill " << i;
        committed += *acknowledged - before;
        unacknowledged += entries != *acknowledged;
        *acknowledged = entries;
    }
    munmap(acknowledged, 4096);
    printf("%u kills: lock found stale %u times, half set up %u, absent %u; %zu entries "
           "acknowledged, none lost; %zu batches survived unacknowledged\n",
           kills, found[sqloNLCKStale], found[sqloNLCKSetupDied] + found[sqloNLCKSettingUp],
           found[sqloNLCKAbsent], committed, unacknowledged);
    EXPECT_GT(found[sqloNLCKStale], kills / 20);
}

TEST_F(ProcessTest, EveryBatchOfEightProcessesIsAppendedOnceAndReadWhole)
{
    const int processes = 8, batches = 600 / static_cast<int>(slowdown);
    store(filesOf(" 9/ 9"));
    for (; writer < processes; writer++)
        inChild([&] {
            int done = 0;
            while (done < batches && batch(3) == 0)
                done++;
            return done != batches;
        });
    int rows = 9, reads = 0;
    for (int ended = 0; ended < processes; reads++) {
        const int before = std::exchange(rows, readCommitted());
        EXPECT_EQ(0, rows % 3);
        EXPECT_GE(rows, before);
        for (int status = 0; waitpid(-1, &status, WNOHANG) > 0; ended++)
            EXPECT_EQ(0, status);
    }
    const std::vector<size_t> found = writers();
    for (int by = 0; by < processes; by++)
        EXPECT_EQ(3 * batches + (by == 0 ? 9 : 0),
                  std::ranges::count(found, static_cast<size_t>(by)));
    EXPECT_EQ(found.size(), static_cast<size_t>(readCommitted()));
    printf("%d reads beside %d processes of %d batches\n", reads, processes, batches);
}

TEST_F(ProcessTest, EverybodyIsToldThatTheHolderDiedUntilItsSetIsRemoved)
{
    int ends[2];
    ASSERT_EQ(0, pipe(ends));
    store(filesOf(" 10/ 10"));
    const pid_t holder = inChild([&] {
        char byte;
        close(ends[1]);
        if (sqluhBeginBatch(&mine, directory.data()) != 0 || append(mine, 3) != 0)
            return 1;
        // A child that outlives it does not make it look alive.
        return fork() == 0 ? static_cast<int>(read(ends[0], &byte, 1)) : pause();
    });
    while (slurp(historyPath).size() < samples.at(13).size())
        usleep(100);
    // Where only the lock helps, a reader waits for that of the living for some seconds, and leaves
    // that of the dead.
    fileSystem = NFS_SUPER_MAGIC;
    impatience = 1;
    EXPECT_EQ(sqloNLCKBusy, readCommitted());
    impatience = 0;
    const SQLO_NLCKSTATE held = lockState();
    EXPECT_EQ(sqloNLCKHeld, held.state);
    EXPECT_EQ(holder, held.pid);
    EXPECT_EQ(sqloNLCKBusy, sqloNLCKRemoveDead(&lock, &held));
    pid_t waiting[4];
    for (pid_t& pid : waiting)
        pid = inChild([this] { return batch(1) != sqloNLCKOwnerDied; });
    while (semctl(held.id, 0, GETNCNT) < 4)
        usleep(100);
    kill(holder, SIGKILL);
    EXPECT_EQ(SIGKILL, waitFor(holder));
    for (const pid_t pid : waiting)
        EXPECT_EQ(0, waitFor(pid));
    EXPECT_EQ(sqloNLCKOwnerDied, openAndClose());
    const SQLO_NLCKSTATE dead = lockState();
    EXPECT_EQ(10, readCommitted());
    fileSystem = 0;
    const SQLO_NLCKSTATE stale = lockState();
    EXPECT_EQ(sqloNLCKStale, stale.state);
    EXPECT_TRUE(dead.id == stale.id && dead.pid == stale.pid);
    EXPECT_EQ(sqloNLCKBusy, sqloNLCKRemoveDead(&lock, &held)); // no longer what was seen
    // Whoever does not know the directory finds the set as well, and none of another node.
    SQLO_NLCK other, elsewhere = {lock.key ^ 1 << 24, -1};
    SQLO_NLCKSTATE found = {};
    bool isFound = false;
    ASSERT_EQ(0, sqloNLCKLock(&elsewhere, 0, 0));
    for (int index = 0, rc = 0; (rc = sqloNLCKNext(&index, &other, &found)) != END_OF_FILE;) {
        ASSERT_EQ(0, rc);
        EXPECT_EQ(0, (other.key ^ lock.key) >> 24);
        isFound |= found.id == stale.id && found.state == sqloNLCKStale && other.key == lock.key;
    }
    EXPECT_TRUE(isFound);
    EXPECT_EQ(0, sqloNLCKUnlock(&elsewhere));
    EXPECT_EQ(0, sqloNLCKRemoveDead(&lock, &stale));
    EXPECT_EQ("", faultOf({10}));
    EXPECT_EQ(0, close(ends[0]) + close(ends[1])); // which ends that child
}

// Creation, fatal recovery and the first piece of a restore put a new file in the history's place,
// whose lock has another key: whoever came before or comes then has to wait all the same.
TEST_F(ProcessTest, NobodyGetsInWhileTheHolderOfANewFileWorks)
{
    for (const char* before : {"-", "junk", " 10/ 10"}) {
        store(filesOf(before));
        ASSERT_EQ(0, sqluhBeginBatch(&mine, directory.data()));
        const pid_t earlier = inChild([this] { return batch(1) != 0; });
        for (int i = 0; i < 20000 && semctl(mine->namedLock.id, 0, GETNCNT) != 1; i++)
            usleep(100);
        EXPECT_EQ(0, restore(mine, samples.at(2)));
        const pid_t later = inChild([this] { return batch(1) != 0; });
        usleep(20000);
        EXPECT_EQ(0, waitpid(earlier, nullptr, WNOHANG) + waitpid(later, nullptr, WNOHANG));
        EXPECT_EQ(0, sqluhClose(&mine));
        EXPECT_EQ(0, waitFor(earlier) + waitFor(later));
        EXPECT_EQ(4u, writers().size());
        EXPECT_EQ(0, removeSetsLeft());
    }
}

// Between the moves, or after them, somebody else may come, make the pair and commit to it.
TEST_F(ProcessTest, APairThatSomebodyElseMadeMeanwhileStays)
{
    for (const char* moment : {"sqlomove", "semget"}) {
        int times = 0;
        store(filesOf("junk/junk"));
        onCall = [&](const std::string& call, int) {
            if (call == moment && ++times == 2) {
                EXPECT_EQ(0, waitFor(inChild([&] { return batch(1); })));
            }
            return 0;
        };
        EXPECT_EQ(0, batch(1, sqluhAbandon));
        onCall = nullptr;
        EXPECT_LE(2, times);
        EXPECT_EQ(0, openAndClose());
        EXPECT_EQ(1u, writers().size()) << moment;
    }
}

using RestoreTest = ProcessTest;

// It may find nothing but damage, and move the new file aside; and then fail to make its own.
TEST_F(RestoreTest, DoesNotFollowAFileThatWasMovedAside)
{
    for (const bool isFull : {false, true}) {
        EXPECT_EQ(0, restoreMeeting([&] {
                      spill(shadowPath, "junk");
                      EXPECT_EQ(0, waitFor(inChild([&] {
                                    failSystemCall("write", isFull ? ENOSPC : 0);
                                    return openAndClose() != (isFull ? int{DISK_FULL} : 2160);
                                })));
                  }));
        EXPECT_EQ(0, sqluhClose(&mine));
        EXPECT_TRUE(samples.at(2) == slurp(historyPath) && samples.at(2) == slurp(shadowPath));
        EXPECT_EQ(0, removeSetsLeft());
    }
}

// It may die in a batch on the new file: what it has left is not copied.
TEST_F(RestoreTest, LeavesTheShadowToADeadProcessBatch)
{
    EXPECT_EQ(sqloNLCKOwnerDied, restoreMeeting([&] {
                  waitFor(inChild([&] {
                      SQLUH_HANDLE* batch = nullptr;
                      return sqluhBeginBatch(&batch, directory.data()) + append(batch, 1);
                  }));
              }));
    EXPECT_EQ(sqloNLCKOwnerDied, sqluhClose(&mine));
    const SQLO_NLCKSTATE state = lockState();
    EXPECT_EQ(0, sqloNLCKRemoveDead(&lock, &state));
    EXPECT_EQ("", faultOf({10}));
}

// No room for the shadow, an administrator's hand at the lock, or a piece that failed, which
// another does not make good: the old history stays. A new beginning makes it good.
TEST_F(RestoreTest, IsRefusedWhereItCouldNotBeFinished)
{
    const auto failPiece = [this] {
        unsigned char piece[] = "piece";
        failSystemCall("write", ENOSPC);
        EXPECT_EQ(DISK_FULL, sqluh_write_restore_buffer(mine, 1024, piece, 5));
        onSystemCall = nullptr;
        return sqluh_write_restore_buffer(mine, 1024, piece, 5);
    };
    const struct {
        std::function<int()> happens;
        int rc;
    } rows[] = {{[] { return failSystemCall("reserve", ENOSPC), 0; }, DISK_FULL},
                {[this] { return semctl(mine->namedLock.id, 0, IPC_RMID); }, sqloNLCKLost},
                {failPiece, DISK_FULL},
                {[&] { return failPiece() + restore(mine, samples.at(2)); }, 0}};
    for (const auto& row : rows) {
        EXPECT_EQ(0, restoreMeeting([] {}));
        const std::string shadow = slurp(shadowPath);
        EXPECT_EQ(0, row.happens());
        EXPECT_EQ(row.rc, sqluhClose(&mine));
        onSystemCall = nullptr;
        EXPECT_EQ(row.rc != 0, shadow == slurp(shadowPath));
        EXPECT_EQ("", faultOf({row.rc == 0 ? 2u : 10u}));
    }
}

// The lock taken away, by its removal or by a step that fakes the holder's death: the holder's
// batch is refused, and what others did meanwhile stays.
TEST_F(ProcessTest, ABatchWhoseLockWasTakenAwayIsRefused)
{
    for (const bool isRemoved : {true, false}) {
        store(filesOf(" 10/ 10"));
        ASSERT_EQ(0, sqluhBeginBatch(&mine, directory.data()));
        EXPECT_EQ(0, append(mine, 2));
        EXPECT_EQ(0, waitFor(inChild([&] {
                      sembuf step = {0, 1, 0};
                      if (!isRemoved)
                          return semop(mine->namedLock.id, &step, 1) != 0 ||
                                 batch(1) != sqloNLCKOwnerDied ||
                                 lockState().state != sqloNLCKFaked;
                      return semctl(mine->namedLock.id, 0, IPC_RMID) != 0 || batch(1) != 0;
                  })));
        EXPECT_EQ(sqloNLCKLost, sqluhEndBatch(&mine, sqluhCommit));
        EXPECT_EQ("", faultOf({isRemoved ? 11u : 10u}));
    }
}

// No descriptor, or no right, be it for a moment: what may be sound is neither moved aside nor
// replaced.
TEST_F(ProcessTest, AFileThatCannotBeOpenedStays)
{
    const struct {
        const char* before;
        unsigned int opens; // that fail; after the lock's own, history and shadow are opened twice
        bool isRepair;
        unsigned int outcome;
    } rows[] = {{" 10/ 10", ~0u, false, 10},
                {" 10/ 10", 0b11110, false, 10},
                {"junk/ 10", 0b10100, false, 10},
                {"C12/ 10", 0b01010, true, 12}};
    for (const auto& row : rows)
        for (const int error : {EMFILE, EACCES}) {
            SCOPED_TRACE(testing::Message() << row.before << " " << row.opens << " " << error);
            store(filesOf(row.before));
            unsigned int opens = 0;
            onSystemCall = [&](const std::string& call) {
                return call == "open" && (row.opens >> std::min(opens++, 31u) & 1) != 0 ? error : 0;
            };
            const int rc = row.isRepair ? int{HISTORY_FILE_DAMAGED} : sqloSystemError | error;
            bool isEmpty = false;
            EXPECT_EQ(rc, openAndClose());
            opens = 0;
            EXPECT_EQ(rc, sqluhIsHistoryFileEmpty(directory.data(), &isEmpty));
            opens = 0;
            EXPECT_EQ(rc, batch(1));
            onSystemCall = nullptr;
            EXPECT_TRUE(row.isRepair || load() == filesOf(row.before));
            EXPECT_EQ("", faultOf({row.outcome}));
        }
}

TEST_F(ProcessTest, AThreadDoesNotWaitForItself)
{
    store(filesOf(" 10/ 10"));
    ASSERT_EQ(0, sqluhBeginBatch(&mine, directory.data()));
    EXPECT_EQ(sqloNLCKDeadlock, batch(1));
    // Nor for another directory whose key is the same.
    bool isEmpty = false;
    spill(sourceDirectory + SQLUH_HISTORY_NAME, samples.at(1));
    onlyKey = mine->namedLock.key;
    EXPECT_EQ(sqloNLCKDeadlock, sqluhIsHistoryFileEmpty(sourceDirectory.data(), &isEmpty));
    onlyKey = -1;
    int other = -1;
    std::thread waiter([&] { other = openAndClose(); });
    usleep(20000);
    EXPECT_EQ(-1, other);
    EXPECT_EQ(0, sqluhEndBatch(&mine, sqluhCommit));
    waiter.join();
    EXPECT_EQ(0, other);
    // Nor for a lock that it could not release.
    failCall("semctl", IPC_RMID, EPERM);
    EXPECT_EQ(sqloSystemError | EPERM, sqluhIsHistoryFileEmpty(directory.data(), &isEmpty));
    onCall = nullptr;
    EXPECT_FALSE(isEmpty);
    EXPECT_EQ(sqloNLCKDeadlock, openAndClose());
    EXPECT_EQ(1, removeSetsLeft());
    EXPECT_EQ(0, openAndClose());
}
