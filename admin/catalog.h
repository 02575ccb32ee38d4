// The backup images of a history and what a restore to each needs, found with the planner's stages.
#pragma once

#include "admin/zq3hist.h"
#include "tool/zq3ckrst.h"

struct imageCatalog {
    historyData history; // every entry that matters, by time
    int oldestImage;     // positions in it; -1: none
    int firstRename;
    int renamedUpTo;    // renames before this position have been applied to what is older
    int countedUpTo;    // images without tablespaces before this position have been counted
    int numEmptyImages; // their number
};

// Reads the history. Complains on failure and returns exitFailed, else 0.
int readCatalog(historyPlace* place, imageCatalog* catalog);
void freeCatalog(imageCatalog* catalog);

bool isImage(const historyEntry* entry);
const char* kindOfImage(const historyEntry* image);  // full, incremental, delta
const char* scopeOfImage(const historyEntry* image); // database, tablespace

// What a restore to one image needs.
struct imagePlan {
    int firstEntry;            // the plan's entries are the catalog's from here to the target
    restorePlan stages;        // its list is the plan's columns, its matrix is pruned
    const historyEntry** rows; // the images of the matrix's rows
    int numImages;             // that are needed, the target included
    int numIncomplete;         // tablespaces that lack an image
};

// What is to be planned.
struct planScope {
    char** names; // the tablespaces, upper-cased in place; none: all of the target
    int numNames;
    bool allRows; // rows for all images up to the target, not only as far back as chains reach
};

// Plans a restore to the image at a position of the catalog. Targets are planned in ascending
// order. Returns 0, or exitFailed after a complaint. freeImagePlan accepts a zero-filled record.
int planImage(imageCatalog* catalog, int target, const planScope* scope, imagePlan* plan);
void freeImagePlan(imagePlan* plan);

// Calls about a plan's cells; rows count from the plan's first image.
const historyEntry* imageOfRow(const imagePlan* plan, int row);
char cellAt(const imagePlan* plan, int row, int column);
int countNeeded(const imagePlan* plan, int row); // tablespaces needed from the image
bool isNeeded(const imagePlan* plan, int row);   // whether the plan holds the image

// Whether nothing is missing for the tablespace; if something is, *image receives the timestamp of
// the image that is, or null where that is any full image.
bool isChainComplete(const imagePlan* plan, int column, const char** image);

// Prints the "missing" member of a plan's JSON object (images.cpp).
void putJsonMissing(const imagePlan* plan);
