// The restore order report.
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "tool/zq3ckrst.h"

static const char rule[] = "====================================================================\n";
static_assert(sizeof rule == 68 + 2);

static void printWholeImage(const char* alias, const char* timestamp)
{
    printf(" restore db %s incremental taken at %s\n", alias, timestamp);
}

// The command that names the target.
static void printTarget(const restorePlan* plan, const char* alias, const char* timestamp,
                        restoreKind kind)
{
    printf(" restore db %s", alias);
    if (kind == restoreTablespace) {
        printf(" tablespace (");
        for (int i = 0; i < plan->numTablespaces; i++)
            printf(i == 0 ? " %s" : ", %s", plan->list[i].name);
        printf(" )");
    }
    printf(" incremental taken at %s\n", timestamp);
}

// Marks in selected the tablespaces that are needed from the image of a row; returns their number.
static int selectTablespaces(const restorePlan* plan, int row)
{
    size_t columns = static_cast<size_t>(plan->numTablespaces);
    const char* cells = plan->matrix + static_cast<size_t>(row) * columns;
    int count = 0;
    // Nothing is needed from most images: all cells are like the one before, and the first unused.
    if (cells[0] == cellUnused && memcmp(cells, cells + 1, columns - 1) == 0) {
        memset(plan->selected, 0, columns);
        return 0;
    }
    for (size_t i = 0; i < columns; i++) {
        plan->selected[i] = cells[i] != cellUnused ? 1 : 0;
        count += cells[i] != cellUnused;
    }
    return count;
}

static void printSelected(const restorePlan* plan, const char* alias, const char* timestamp,
                          int count)
{
    printf(" restore db %s tablespace (", alias);
    for (int i = 0; i < plan->numTablespaces && count > 0; i++)
        if (plan->selected[i])
            printf(" %s%s", plan->list[i].name, --count > 0 ? "," : " )");
    printf(" incremental taken at %s\n", timestamp);
}

// An image is restored whole when all that it holds is needed, whatever kind of restore it is.
static void printRow(const restorePlan* plan, const char* alias, int row)
{
    const backupImage* image = &plan->images[row];
    int count = plan->numTablespaces > 0 ? selectTablespaces(plan, row) : 0;
    if (count == image->numTablespaces)
        printWholeImage(alias, image->timestamp);
    else if (count != 0)
        printSelected(plan, alias, image->timestamp, count);
}

int printRestoreOrder(restorePlan* plan, const char* alias, const char* timestamp, restoreKind kind)
{
    printf("\nSuggested restore order of images using timestamp %s for\n", timestamp);
    printf("database %s.\n%s", alias, rule);
    printTarget(plan, alias, timestamp, kind);

    if (plan->numTablespaces > 0) {
        plan->selected = static_cast<char*>(calloc(static_cast<size_t>(plan->numTablespaces), 1));
        if (plan->selected == nullptr)
            return failStage(msgNoMemorySelected);
    }
    for (int row = 0; row < plan->numBackups; row++)
        printRow(plan, alias, row);

    printf("%s\n", rule);
    return 0;
}
