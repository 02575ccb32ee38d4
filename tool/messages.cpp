// The two forms of the planner's error report, and the release of a plan.
#include <cstdio>
#include <cstdlib>

#include "tool/zq3ckrst.h"

const char errorString[] = "Error: zq3ckrst -";

int reportError(const planMessage& message, const char* argument)
{
    char text[512];
    snprintf(text, sizeof text, message.text, argument);

    fflush(stdout); // what was listed before the failure stands before it on a terminal, too
    fprintf(stderr, "\n%s %s", errorString, text);
    fprintf(stderr, "\nReturn code of %d seen at line %u\n\n", message.code, message.site);
    return message.code;
}

int reportScanError(const planMessage& message, int sqlcode)
{
    if (sqlcode != 0) {
        fprintf(stderr, "\n%s ", errorString);
        fprintf(stderr, "%s returned SQLCA Code %d at line %u\n\n", message.text, sqlcode,
                message.site);
    }
    return message.code;
}

void freePlan(restorePlan* plan)
{
    for (int i = 0; i < plan->histData.numEntries; i++)
        free(plan->histData.entries[i].tablespaceNames);
    free(plan->histData.entries);
    free(plan->matrix);
    free(plan->images);
    free(plan->list);
    free(plan->selected);
    *plan = {};
}
