// zq3hist plan: the images that a restore needs, one a line.
#include <cstring>

#include "admin/chains.h"
#include "admin/json.h"
#include "zq3.h"

// What is asked, and what is known to answer it.
struct planRequest {
    historyPlace* place;
    const char* timestamp; // of the target; null: the newest up to the time in before
    const char* before;    // empty: without end
    char** names;          // none: all tablespaces of the target
    int numNames;
    imageCatalog catalog;
    chainWalk walk; // of the history as it is read: a plan changes names in it
    int target;     // position
    int restorable; // position of the newest image that can be restored; -1: none
    const numberGap* gap;
    imagePlan plan;
};

// --- The target ----------------------------------------------------------------------------------

// The position of a name among an image's; -1: it is not there.
static int slotOfName(const historyEntry* image, const char* name)
{
    for (uint32_t i = 0; i < image->numTablespaces; i++)
        if (strcmp(image->tablespaceNames[i], name) == 0)
            return static_cast<int>(i);
    return -1;
}

// The first of the names that an image does not hold; null: it holds all.
static const char* nameNotHeld(const planRequest* request, const historyEntry* image)
{
    for (int i = 0; i < request->numNames; i++)
        if (slotOfName(image, request->names[i]) < 0)
            return request->names[i];
    return nullptr;
}

static bool canRestore(const planRequest* request, int position)
{
    const imageChains* chains = &request->walk.images[position];
    if (request->numNames == 0)
        return chains->numIncomplete == 0;
    const historyEntry* image = &request->catalog.history.entries[position];
    for (int i = 0; i < chains->numLinks; i++) {
        const chainLink* link = &request->walk.links[chains->firstLink + i];
        for (int name = 0; link->lack != lacksNothing && name < request->numNames; name++)
            if (link->slot == slotOfName(image, request->names[name]))
                return false;
    }
    return true;
}

// The position of the newest image in time that holds the names; -1: none. like: null, or an image
// whose scope it must have, and a restore to it must be possible.
static int findNewest(const planRequest* request, const historyEntry* like)
{
    const historyData* history = &request->catalog.history;
    for (int i = history->numEntries - 1; i >= 0; i--) {
        const historyEntry* image = &history->entries[i];
        if (!isImage(image) || nameNotHeld(request, image) != nullptr ||
            (request->before[0] != '\0' && strcmp(image->timestamp, request->before) > 0))
            continue;
        if (like == nullptr ||
            (canRestore(request, i) && scopeOfImage(image) == scopeOfImage(like)))
            return i;
    }
    return -1;
}

// An image of some tablespaces that was not asked for by its timestamp may not be what was meant.
static void noteScope(const planRequest* request, const historyEntry* target)
{
    int whole = request->target;
    while (whole >= 0 && (!isImage(&request->catalog.history.entries[whole]) ||
                          request->catalog.history.entries[whole].object == zq3ObjectTablespace))
        whole--;
    if (request->timestamp == nullptr && request->numNames == 0 && whole >= 0 &&
        whole != request->target)
        fprintf(stderr,
                "zq3hist: note: %s is an image of single tablespaces; the newest one of the whole "
                "database before it is %s\n",
                target->timestamp, request->catalog.history.entries[whole].timestamp);
}

static int findTarget(planRequest* request)
{
    request->target = request->timestamp == nullptr
                          ? findNewest(request, nullptr)
                          : findImage(&request->catalog, request->timestamp);
    if (request->target < 0) {
        if (request->timestamp != nullptr)
            return failNoImage(request->place, &request->catalog, request->timestamp);
        fail(request->place->directory, "no image%s is there%s%s",
             request->numNames == 0 ? "" : " with these tablespaces",
             request->before[0] == '\0' ? "" : " up to ", request->before);
        hint(request->place, "zq3hist images DIR  # lists all");
        return exitNoImage;
    }
    const historyEntry* target = &request->catalog.history.entries[request->target];
    const char* name = nameNotHeld(request, target);
    if (name != nullptr) {
        fail(target->timestamp, "the image does not hold the tablespace %s", name);
        return exitNoImage;
    }
    noteScope(request, target);
    request->restorable = findNewest(request, target);
    request->gap = gapBetween(&request->catalog, request->walk.images[request->target].oldest,
                              request->target);
    return 0;
}

// --- The plan ------------------------------------------------------------------------------------

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

static bool isWhole(const imagePlan* plan, int row)
{
    return countNeeded(plan, row) == static_cast<int>(plan->rows[row]->numTablespaces);
}

static void printEscaped(const char* before, const char* text)
{
    fputs(before, stdout);
    putEscaped(stdout, text, strlen(text));
}

static void showPlanLine(const imagePlan* plan, int row, int position, int width)
{
    const historyEntry* image = plan->rows[row];
    int count = countNeeded(plan, row);
    printf("%*d/%d  %-11s  ", width, position, plan->numImages, kindOfImage(image));
    printEscaped("", image->timestamp);
    const char* separator = "  ";
    if (count > 1 && isWhole(plan, row))
        printf("  all %d", count);
    else
        for (int column = 0; column < plan->stages.numTablespaces; column++)
            if (cellAt(plan, row, column) != cellUnused) {
                printEscaped(separator, plan->stages.list[column].name);
                separator = ", ";
            }
    separator = "  for ";
    for (int later = nextNeeder(plan, row, row); later >= 0; later = nextNeeder(plan, row, later)) {
        printEscaped(separator, plan->rows[later]->timestamp);
        separator = ", ";
    }
    puts(row == plan->stages.numBackups - 1 ? "  target" : "");
}

static void showJsonLine(jsonWriter* json, const imagePlan* plan, int row, int position)
{
    beginJson(json, nullptr, '{');
    putJsonNumber(json, "position", position);
    putJsonImage(json, plan->rows[row]);
    beginJson(json, "tablespaces", '[');
    for (int column = 0; column < plan->stages.numTablespaces; column++)
        if (cellAt(plan, row, column) != cellUnused)
            putJsonText(json, nullptr, plan->stages.list[column].name);
    endJson(json, ']');
    putJsonBool(json, "whole", isWhole(plan, row));
    beginJson(json, "neededBy", '[');
    for (int later = nextNeeder(plan, row, row); later >= 0; later = nextNeeder(plan, row, later))
        putJsonText(json, nullptr, plan->rows[later]->timestamp);
    endJson(json, ']');
    endJson(json, '}');
}

static const char* timestampAt(const planRequest* request, int position)
{
    return position < 0 ? nullptr : request->catalog.history.entries[position].timestamp;
}

static void showJsonPlan(const planRequest* request)
{
    const imagePlan* plan = &request->plan;
    jsonWriter json = {};
    beginAnswer(&json);
    putJsonText(&json, "target", timestampAt(request, request->target));
    putJsonBool(&json, "complete", plan->numIncomplete == 0);
    beginJson(&json, "images", '[');
    for (int row = 0, position = 1; row < plan->stages.numBackups; row++)
        if (isNeeded(plan, row))
            showJsonLine(&json, plan, row, position++);
    endJson(&json, ']');
    putJsonNumber(&json, "neededCount", plan->numImages);
    beginJson(&json, "missing", '[');
    for (int column = 0; column < plan->stages.numTablespaces; column++) {
        const char* image;
        if (lackOfColumn(&request->catalog, plan, column, &image) != planLacksNothing)
            putJsonLack(&json, plan->stages.list[column].name, image);
    }
    endJson(&json, ']');
    putJsonGap(&json, request->gap);
    putJsonText(&json, "newestRestorable", timestampAt(request, request->restorable));
    endJsonLine(&json);
}

static void showPlan(const imagePlan* plan)
{
    int width = snprintf(nullptr, 0, "%d", plan->numImages);
    for (int row = 0, position = 1; row < plan->stages.numBackups; row++)
        if (isNeeded(plan, row))
            showPlanLine(plan, row, position++, width);
}

// Whether two columns lack the same image, or both any full one.
static bool lackSame(const planRequest* request, int a, int b)
{
    const char *imageOfA, *imageOfB;
    planLack lack = lackOfColumn(&request->catalog, &request->plan, a, &imageOfA);
    if (lack != lackOfColumn(&request->catalog, &request->plan, b, &imageOfB))
        return false;
    return imageOfA == imageOfB ||
           (imageOfA != nullptr && imageOfB != nullptr && strcmp(imageOfA, imageOfB) == 0);
}

// Says what a column lacks, and how many others with it, unless it was said of one before it.
static void failColumn(const planRequest* request, int column)
{
    const imagePlan* plan = &request->plan;
    const char* timestamp = timestampAt(request, request->target);
    const char* image;
    planLack lack = lackOfColumn(&request->catalog, plan, column, &image);
    int count = 1;
    for (int other = 0; lack != planLacksNothing && other < plan->stages.numTablespaces; other++) {
        bool isSame = other != column && lackSame(request, column, other);
        if (isSame && other < column)
            return;
        count += isSame;
    }
    char who[64];
    if (count == 1)
        snprintf(who, sizeof who, "tablespace %s lacks", plan->stages.list[column].name);
    else if (count == plan->stages.numTablespaces)
        snprintf(who, sizeof who, "all %d tablespaces lack", count);
    else
        snprintf(who, sizeof who, "tablespace %s and %d more lack", plan->stages.list[column].name,
                 count - 1);
    char what[lackCapacity];
    describeLack(image, what);
    if (lack != planLacksNothing)
        fail(timestamp, "%s %s%s", who, what,
             lack == planLacksOnHand                         ? ", which is not on hand"
             : lack == planLacksRestored && image[0] != '\0' ? " that was restored"
                                                             : "");
}

// Tells which chains are open, and where a restore is possible.
static int failIncomplete(const planRequest* request)
{
    for (int column = 0; column < request->plan.stages.numTablespaces; column++)
        failColumn(request, column);
    char advice[128] = "zq3hist images DIR  # no image of this scope can be restored";
    if (request->catalog.onHand != nullptr)
        snprintf(advice, sizeof advice, "zq3hist images DIR  # all, also those not on hand");
    if (request->restorable >= 0)
        snprintf(advice, sizeof advice,
                 "zq3hist plan DIR %s  # the newest image that can be restored",
                 timestampAt(request, request->restorable));
    hint(request->place, advice);
    return exitIncomplete;
}

static void warnOfGap(const planRequest* request)
{
    char gap[gapCapacity];
    describeGap(request->gap, gap);
    fprintf(stderr,
            "zq3hist: warning: a chain was found, but the history lacks %s, and an image may have "
            "been there\n",
            gap);
}

// --- The command line ----------------------------------------------------------------------------

static int takeRequest(commandLine* line, planRequest* request, char* timestamp)
{
    request->place = &line->place;
    request->before = line->before;
    request->names = line->arguments;
    request->numNames = line->numArguments;
    const char* first = line->numArguments > 0 ? line->arguments[0] : "";
    bool isLatest = strcmp(first, "latest") == 0;
    if (isLatest || line->before[0] == '\0') {
        request->names++;
        request->numNames--;
    }
    if (request->numNames < 0)
        return failForm(line);
    if (!isLatest && line->before[0] == '\0') {
        request->timestamp = timestamp;
        if (takeInstant("plan", first, timestamp) != 0)
            return exitUsage;
    }
    for (int i = 0; i < request->numNames; i++)
        str2upper(request->names[i]);
    return 0;
}

int planMain(commandLine* line)
{
    planRequest request = {};
    char timestamp[timestampLength + 1];
    int rc = takeRequest(line, &request, timestamp);
    if (rc == 0)
        rc = readCatalog(&line->place, line->have, &request.catalog);
    if (rc == 0)
        rc = walkChains(&request.catalog, request.catalog.history.numEntries - 1, &request.walk);
    if (rc == 0)
        rc = findTarget(&request);
    if (rc == 0)
        rc = planImage(&request.catalog, request.target, request.names, request.numNames,
                       &request.plan);
    // A plan with a hole is no plan; scripts are told of the hole by the object's members.
    if (rc == 0 && line->json)
        showJsonPlan(&request);
    else if (rc == 0 && request.plan.numIncomplete == 0)
        showPlan(&request.plan);
    if (rc == 0 && request.plan.numIncomplete != 0)
        rc = failIncomplete(&request);
    else if (rc == 0 && request.gap != nullptr)
        warnOfGap(&request);
    freeImagePlan(&request.plan);
    freeChains(&request.walk);
    freeCatalog(&request.catalog);
    return rc;
}
