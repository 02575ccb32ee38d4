// zq3hist plan: the images that a restore needs, one a line.
#include "admin/catalog.h"

#include <cstring>

#include "admin/json.h"

// The next row, later than the one given as after, to which some tablespace goes straight from row;
// -1: there is none.
static int nextNeeder(const imagePlan* plan, int row, int after)
{
    int next = -1;
    for (int column = 0; column < plan->stages.numTablespaces; column++) {
        if (cellAt(plan, row, column) == cellUnused)
            continue;
        int later = row + 1;
        while (later < plan->stages.numBackups && cellAt(plan, later, column) == cellUnused)
            later++;
        if (later < plan->stages.numBackups && later > after && (next < 0 || later < next))
            next = later;
    }
    return next;
}

// Prints what stands for each item of a list: a timestamp or a name.
static void putItem(const char* text, bool json, bool first)
{
    fputs(first ? "" : json ? "," : ", ", stdout);
    if (json)
        putJsonText(stdout, text, strlen(text));
    else
        putEscaped(stdout, text, strlen(text));
}

static void putTablespaces(const imagePlan* plan, int row, bool json)
{
    bool first = true;
    for (int column = 0; column < plan->stages.numTablespaces; column++) {
        if (cellAt(plan, row, column) == cellUnused)
            continue;
        putItem(plan->stages.list[column].name, json, first);
        first = false;
    }
}

static void putNeeders(const imagePlan* plan, int row, bool json)
{
    bool first = true;
    for (int later = nextNeeder(plan, row, row); later >= 0; later = nextNeeder(plan, row, later)) {
        if (first && !json)
            fputs("  for ", stdout);
        putItem(imageOfRow(plan, later)->timestamp, json, first);
        first = false;
    }
}

static void showLine(const imagePlan* plan, int row, int position)
{
    const historyEntry* image = imageOfRow(plan, row);
    printf("%d/%d  %-11s  ", position, plan->numImages, kindOfImage(image));
    putItem(image->timestamp, false, true);
    fputs("  ", stdout);
    putTablespaces(plan, row, false);
    putNeeders(plan, row, false);
    if (row == plan->stages.numBackups - 1)
        fputs("  target", stdout);
    putchar('\n');
}

static void showJsonLine(const imagePlan* plan, int row, int position)
{
    const historyEntry* image = imageOfRow(plan, row);
    printf("%s{\"position\":%d,\"kind\":\"%s\",\"scope\":\"%s\",\"timestamp\":",
           position == 1 ? "" : ",", position, kindOfImage(image), scopeOfImage(image));
    putItem(image->timestamp, true, true);
    fputs(",\"tablespaces\":[", stdout);
    putTablespaces(plan, row, true);
    printf("],\"whole\":%s,\"neededBy\":[",
           countNeeded(plan, row) == static_cast<int>(image->numTablespaces) ? "true" : "false");
    putNeeders(plan, row, true);
    fputs("]}", stdout);
}

static void showPlan(const imagePlan* plan, const char* timestamp, bool json)
{
    if (json) {
        fputs("{\"target\":", stdout);
        putItem(timestamp, true, true);
        printf(",\"complete\":%s,\"images\":[", plan->numIncomplete == 0 ? "true" : "false");
    }
    int position = 0;
    for (int row = 0; row < plan->stages.numBackups; row++) {
        if (!isNeeded(plan, row))
            continue;
        position++;
        if (json)
            showJsonLine(plan, row, position);
        else
            showLine(plan, row, position);
    }
    if (json) {
        fputs("],", stdout);
        putJsonMissing(plan);
        puts("}");
    }
}

// Tells which chains are open, on standard error.
static int failIncomplete(const imagePlan* plan, const char* timestamp)
{
    for (int column = 0; column < plan->stages.numTablespaces; column++) {
        const char* image;
        if (isChainComplete(plan, column, &image))
            continue;
        const char* name = plan->stages.list[column].name;
        if (image == nullptr)
            fail(timestamp, "tablespace %s lacks a full image", name);
        else
            fail(timestamp, "tablespace %s lacks the image %s that was restored", name, image);
    }
    return exitFailed;
}

int planMain(commandLine* line)
{
    imageCatalog catalog = {};
    imagePlan plan = {};
    const char* timestamp = line->arguments[0];
    const planScope scope = {line->arguments + 1, line->numArguments - 1, true};
    int rc = readCatalog(&line->place, &catalog);
    int target = 0;
    while (target < catalog.history.numEntries &&
           (!isImage(&catalog.history.entries[target]) ||
            strcmp(catalog.history.entries[target].timestamp, timestamp) != 0))
        target++;
    if (rc == 0 && target == catalog.history.numEntries) {
        rc = fail(line->place.directory, "no image has the timestamp %s", timestamp);
        hint(&line->place, "zq3hist images DIR lists all");
    }
    if (rc == 0)
        rc = planImage(&catalog, target, &scope, &plan);
    // A plan with a hole is no plan; scripts are told of the hole by the object's members.
    if (rc == 0 && (line->json || plan.numIncomplete == 0))
        showPlan(&plan, timestamp, line->json);
    if (rc == 0 && plan.numIncomplete != 0)
        rc = failIncomplete(&plan, timestamp);
    freeImagePlan(&plan);
    freeCatalog(&catalog);
    return rc;
}
