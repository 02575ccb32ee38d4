// Writing a part of a history as a file of its own.
#include "admin/pair.h"

#include <cstring>

struct partWriter {
    SQLO_FHANDLE source, target;
    SQLUH_HEADER header;
    SQLUH_WORKAREA workArea; // for reading
    SQLUH_WORKAREA record;   // the bytes of an entry as the file has them
    entriesReport totals;
};

static int openBoth(partWriter* writer, const char* source, const char* target)
{
    int rc = sqloopenp(source, sqloOpenRead, sqloPermissions, &writer->source);
    if (rc == 0)
        rc = sqluhReadHeader(writer->source, &writer->header);
    if (rc != 0) // nothing can be taken from it
        writer->header = {};
    writer->header.status = statusConsistent;
    rc = sqluhInitWorkArea(&writer->workArea, defaultWorkAreaSize);
    if (rc == 0)
        rc = sqluhInitWorkArea(&writer->record, lineLength);
    if (rc == 0)
        rc = sqloopenp(target, sqloOpenNew, sqloPermissions, &writer->target);
    if (rc == 0)
        rc = sqluhWriteHeader(writer->target, &writer->header);
    writer->totals.offset = headerLength;
    return rc;
}

// Copies the entry that was just read and leaves the source after it.
static int copyEntry(partWriter* writer, const SQLUH_ENTRY* entry, long long from)
{
    uint32_t moved = 0;
    int rc = 0;
    if (entry->size > writer->record.size) {
        sqlofmblkEx(writer->record.buffer);
        writer->record = {};
        rc = sqluhInitWorkArea(&writer->record, entry->size);
    }
    if (rc == 0)
        rc = sqloseek(writer->source, from, sqloFromStart, nullptr);
    if (rc == 0)
        rc = sqloread(writer->source, writer->record.buffer, entry->size, &moved);
    if (rc == 0)
        rc = sqlowrite(writer->target, writer->record.buffer, entry->size, &moved);
    if (rc == 0) {
        addToReport(&writer->totals, entry);
        writer->totals.offset += entry->size;
    }
    return rc;
}

static int copyEntries(partWriter* writer, partFilter filter, const void* context,
                       partReport* report)
{
    entryRoom room;
    SQLUH_ENTRYWALK walk = {writer->source, &room.entry, &writer->workArea, headerLength, false};
    int rc = 0;
    prepareRoom(&room);
    if (writer->source.descriptor == sqloNoFile.descriptor || writer->header.version == 0)
        return 0;
    while (rc == 0 && (rc = sqluhNextEntry(&walk)) == 0) {
        report->total++;
        if (filter == nullptr || filter(context, &room.data))
            rc = copyEntry(writer, &room.entry, walk.offset);
    }
    report->complete = rc == END_OF_FILE && !walk.cutShort;
    return rc == END_OF_FILE || rc == HISTORY_FILE_DAMAGED ? 0 : rc;
}

static void closeBoth(partWriter* writer, int* rc)
{
    sqlofmblkEx(writer->workArea.buffer);
    sqlofmblkEx(writer->record.buffer);
    if (writer->source.descriptor != sqloNoFile.descriptor)
        sqloclose(writer->source);
    if (writer->target.descriptor == sqloNoFile.descriptor)
        return;
    int closed = sqloclose(writer->target);
    *rc = *rc != 0 ? *rc : closed;
}

int writePart(const char* source, partFilter filter, const void* context, const char* target,
              partReport* report)
{
    partWriter writer = {};
    writer.source = writer.target = sqloNoFile;
    *report = {};
    int rc = openBoth(&writer, source, target);
    if (rc == 0)
        rc = copyEntries(&writer, filter, context, report);
    if (rc == 0) {
        setTotals(&writer.header, &writer.totals);
        rc = sqluhWriteHeader(writer.target, &writer.header);
    }
    if (rc == 0)
        rc = sqlosync(writer.target);
    report->kept = writer.totals.count;
    closeBoth(&writer, &rc);
    return rc;
}
