// The text of one record.
#include "osse.h"

#include <cstdio>
#include <cstring>
#include <ctime>
#include <unistd.h>

static constexpr char cutMark[] = " ... (cut)\n"; // ends a record that did not fit

void osseTextAdd(osseText* text, const char* bytes, size_t count)
{
    const size_t room = text->capacity - sizeof cutMark - text->length;
    if (count > room) {
        count = room;
        text->cut = true;
    }
    memcpy(text->data + text->length, bytes, count);
    text->length += count;
}

void osseTextFormat(osseText* text, const char* format, ...)
{
    char piece[256];
    va_list arguments;
    va_start(arguments, format);
    const int length = vsnprintf(piece, sizeof piece, format, arguments);
    va_end(arguments);
    if (length > 0)
        osseTextAdd(text, piece,
                    static_cast<size_t>(length) < sizeof piece ? static_cast<size_t>(length)
                                                               : sizeof piece - 1);
}

void osseTextStamp(osseText* text)
{
    timespec now;
    tm local;
    char date[32];
    clock_gettime(CLOCK_REALTIME, &now);
    localtime_r(&now.tv_sec, &local);
    const size_t length = strftime(date, sizeof date, "%Y-%m-%d-%H.%M.%S", &local);
    osseTextAdd(text, date, length);
    osseTextFormat(text, ".%06ld pid=%ld", now.tv_nsec / 1000, static_cast<long>(getpid()));
}

void osseTextAddEscaped(osseText* text, const char* bytes, size_t count, const char* newLine)
{
    for (size_t i = 0; i < count; i++) {
        const unsigned char byte = static_cast<unsigned char>(bytes[i]);
        if (byte == '\n')
            osseTextAdd(text, newLine, strlen(newLine));
        else if (byte < ' ' || byte == 0x7F)
            osseTextFormat(text, "\\x%02X", byte);
        else
            osseTextAdd(text, bytes + i, 1);
    }
}

void osseTextEnd(osseText* text)
{
    const char* end = text->cut ? cutMark : "\n";
    const size_t length = strlen(end);
    memcpy(text->data + text->length, end, length + 1);
    text->length += length;
}
