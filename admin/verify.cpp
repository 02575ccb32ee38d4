// zq3hist verify: reads every entry of both files and changes nothing.
#include "admin/pair.h"

#include <cstdio>

static const char* const verdictWords[] = {"sound",      "missing", "refused",
                                           "no history", "damaged", "short"};

static void showFinding(const char* name, const fileFinding* finding, bool isShadow)
{
    const SQLUH_HEADER* header = &finding->file.header;
    const entriesReport* entries = &finding->entries;
    int rc = finding->file.rc != 0 ? finding->file.rc : entries->rc;
    printf("%s: ", name);
    switch (finding->verdict) {
    case fileMissing:
        puts("missing");
        break;
    case fileRefused:
        printf("cannot be read at offset %lld: %s\n", entries->offset, wordsForCode(rc));
        break;
    case fileNoHistory:
        puts("damaged at offset 0: the header cannot be read");
        break;
    case fileDamaged:
        printf("damaged at offset %lld: entry %u cannot be read\n", entries->offset,
               entries->count + 1);
        break;
    case fileShort:
        printf("ends at offset %lld, after %u of %u entries\n", entries->offset, entries->count,
               header->entryCount);
        break;
    case fileSound:
        printf("sound, %u %s", entries->count, entryWord(entries->count));
        if (header->status == statusPending)
            puts(isShadow ? "; the history was made anew from it" : ", and a batch is unfinished");
        else if (header->entryCount != entries->count)
            printf("; its header counts %u\n", header->entryCount);
        else
            puts("");
    }
}

void putJsonFinding(jsonWriter* json, const char* key, const fileFinding* finding)
{
    beginJson(json, key, '{');
    putJsonText(json, "verdict", verdictWords[finding->verdict]);
    putJsonNumber(json, "entryCount", finding->entries.count);
    if (finding->file.rc == 0) {
        putJsonBytes(json, "headerStatus", &finding->file.header.status, 1);
        putJsonNumber(json, "headerEntryCount", finding->file.header.entryCount);
    }
    if (finding->verdict != fileMissing)
        putJsonNumber(json, "endOffset", finding->entries.offset);
    endJson(json, '}');
}

static void showJsonPair(const historyPlace* place, const pairFinding* pair, bool atWork)
{
    jsonWriter json = {};
    beginAnswer(&json);
    putJsonText(&json, "directory", place->directory);
    putJsonBool(&json, "sound", pair->same);
    putJsonBool(&json, "writerAtWork", atWork);
    putJsonFinding(&json, "history", &pair->history);
    putJsonFinding(&json, "shadow", &pair->shadow);
    endJsonLine(&json);
}

// The process whose batch is unfinished, if it lives; else 0.
static int writerOf(const historyPlace* place, const pairFinding* pair)
{
    SQLO_NLCK lock = {};
    SQLO_NLCKSTATE state = {};
    bool unfinished = pair->due != sqluhRepairNone && pair->due != sqluhRepairAnew;
    return unfinished && queryLock(place, &lock, &state) && state.state == sqloNLCKHeld ? state.pid
                                                                                        : 0;
}

static int judge(const historyPlace* place, const pairFinding* pair, bool atWork)
{
    int writer = writerOf(place, pair);
    if (atWork) {
        fail(place->directory, "the history was changed while it was read: verify it again");
        return exitLocked;
    }
    if (writer != 0)
        fprintf(stderr, "zq3hist: process %d is changing the history; what is committed is sound\n",
                writer);
    if (writer != 0 || pair->same)
        return exitDone;
    fail(place->directory, "the history is not sound");
    hintAboutPair(place, pair);
    return pair->refused ? exitFailed : exitDamaged;
}

int verifyMain(commandLine* line)
{
    historyPlace* place = &line->place;
    pairFinding pair;
    bool atWork = false;
    int rc = examineQuietPair(place, true, &pair, &atWork);
    if (rc != 0)
        return rc;
    if (pair.history.verdict == fileMissing && pair.shadow.verdict == fileMissing)
        return failPair(place, &pair, "verify the history");
    if (line->json) {
        showJsonPair(place, &pair, atWork);
    } else {
        showFinding(SQLUH_HISTORY_NAME, &pair.history, false);
        showFinding(SQLUH_SHADOW_NAME, &pair.shadow, true);
        if (pair.due == sqluhRepairShadow && pair.shadow.verdict == fileSound && !pair.same)
            puts("The two files hold different entries.");
    }
    return judge(place, &pair, atWork);
}
