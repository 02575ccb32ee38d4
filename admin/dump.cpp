// zq3hist dump: prints all entries.
#include "admin/pair.h"

#include <cerrno>
#include <cstdio>

#include "admin/stanza.h"

int dumpMain(commandLine* line)
{
    historyPlace* place = &line->place;
    SQLUH_COMMITTED* committed = nullptr;
    int rc = readCommitted(place, &committed);
    if (rc != 0)
        return rc;
    historyRecord* record = newRecord();
    int code = record == nullptr ? sqloSystemError | ENOMEM : 0;
    for (uint32_t row = 0; code == 0; row++) {
        code = takeRow(committed, row, record);
        if (code == 0 && line->json)
            writeJson(stdout, record);
        else if (code == 0)
            writeStanza(stdout, record);
    }
    if (code == committed->failure && code != 0)
        rc = failDamaged(place, committed, "dump the rest");
    else if (code != END_OF_FILE)
        rc = failInPlace(code, "dump the history", place);
    freeRecord(record);
    sqluhFreeCommitted(&committed);
    return rc;
}
