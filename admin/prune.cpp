// zq3hist prune: removes the oldest entries, as far as no image that stays needs them.
#include <cstring>
#include <sys/stat.h>
#include <unistd.h>

#include "admin/chains.h"
#include "admin/pair.h"

struct prunePlan {
    char from[timestampWidth + 1];   // the entries before it go
    char needer[timestampWidth + 1]; // the image that needs what stays before the time asked for
};

// Images that stay must keep theirs: each may move the beginning back, for those older ones too
// that stay because of it.
static int findBeginning(historyPlace* place, const char* before, prunePlan* plan)
{
    imageCatalog catalog = {};
    chainWalk walk = {};
    int rc = readCatalog(place, nullptr, &catalog);
    const historyData* history = &catalog.history;
    if (rc == 0)
        rc = walkChains(&catalog, history->numEntries - 1, &walk);
    snprintf(plan->from, sizeof plan->from, "%s", before);
    for (int i = history->numEntries - 1; rc == 0 && i >= 0; i--) {
        const char* timestamp = history->entries[i].timestamp;
        if (!isImage(&history->entries[i]) || strcmp(timestamp, plan->from) < 0)
            continue;
        const char* oldest = history->entries[walk.images[i].oldest].timestamp;
        if (strcmp(oldest, plan->from) < 0) {
            memcpy(plan->from, oldest, sizeof plan->from);
            memcpy(plan->needer, timestamp, sizeof plan->needer);
        }
    }
    freeChains(&walk);
    freeCatalog(&catalog);
    return rc;
}

static bool stays(const void* context, const char* objectPart)
{
    const prunePlan* plan = static_cast<const prunePlan*>(context);
    return strspn(objectPart, "0123456789") < timestampWidth ||
           memcmp(objectPart, plan->from, timestampWidth) >= 0;
}

// What pruning would come to.
static int rehearsePruning(const historyPlace* place, const prunePlan* plan, partReport* part)
{
    char objectPart[zq3ObjectPartCapacity] = {};
    zq3HistoryData data = {};
    data.objectPart = {objectPart, sizeof objectPart, 0};
    SQLUH_ENTRY entry = {};
    entry.data = &data;
    SQLUH_COMMITTED* committed = nullptr;
    int rc = readCommitted(place, &committed);
    if (rc != 0)
        return rc;
    if (committed->failure != 0)
        rc = failDamaged(place, committed, "prune the history");
    for (uint32_t row = 0; rc == 0 && row < committed->numRows; row++) {
        sqluhGetCommitted(committed, row, &entry, false);
        part->total++;
        part->kept += stays(plan, objectPart);
    }
    sqluhFreeCommitted(&committed);
    return rc;
}

static void tellPart(const prunePlan* plan, const partReport* part, bool dryRun)
{
    const char* would = dryRun ? "would be " : "";
    printf("%u of %u entries %sremoved, those before %s; %u %s\n", part->total - part->kept,
           part->total, would, plan->from, part->kept, dryRun ? "would stay" : "stay");
    if (plan->needer[0] != '\0')
        printf("The entries from %s on stay because the image %s needs them\n", plan->from,
               plan->needer);
}

// What the plan was made from must be what is pruned.
static bool isUnchanged(const struct stat* before, const struct stat* after)
{
    return before->st_ino == after->st_ino && before->st_size == after->st_size &&
           before->st_ctim.tv_sec == after->st_ctim.tv_sec &&
           before->st_ctim.tv_nsec == after->st_ctim.tv_nsec;
}

static int prunePair(historyPlace* place, SQLUH_HANDLE* handle, const struct stat* planned,
                     const prunePlan* plan, char* temporary)
{
    struct stat there = {};
    pairFinding pair;
    partReport part = {};
    keptFiles kept = {};
    int rc = examinePair(place, true, &pair);
    if (rc == 0 && pair.due != sqluhRepairNone)
        return failPair(place, &pair, "prune the history");
    if (rc == 0 && (stat(place->historyPath, &there) != 0 || !isUnchanged(planned, &there)))
        return fail(place->directory, "the history changed meanwhile; prune it again");
    int code = rc == 0 ? writePart(place->historyPath, stays, plan, temporary, &part) : 0;
    if (code != 0)
        rc = failWithCode(code, "write the new history", place->directory);
    bool change = rc == 0 && part.kept < part.total;
    if (change)
        rc = keepPair(handle, &kept);
    if (change && rc == 0)
        rc = replacePair(place, handle, temporary);
    if (rc == 0)
        tellPart(plan, &part, false);
    tellKept(&kept);
    return rc;
}

int pruneMain(commandLine* line)
{
    historyPlace* place = &line->place;
    prunePlan plan = {};
    struct stat planned = {};
    char temporary[pathCapacity];
    SQLUH_HANDLE* handle = nullptr;
    if (line->before[0] == '\0')
        return failUsage("prune takes --before TIMESTAMP");
    stat(place->historyPath, &planned);
    int rc = formTemporary(place->historyPath, temporary);
    if (rc == 0)
        rc = findBeginning(place, line->before, &plan);
    if (rc == 0 && line->dryRun) {
        partReport part = {};
        rc = rehearsePruning(place, &plan, &part);
        if (rc == 0)
            tellPart(&plan, &part, true);
        return rc;
    }
    if (rc == 0)
        rc = lockPair(place, R_OK | W_OK, &handle);
    if (rc == 0) {
        rc = prunePair(place, handle, &planned, &plan, temporary);
        unlink(temporary);
    }
    return unlockPair(place, &handle, rc);
}
