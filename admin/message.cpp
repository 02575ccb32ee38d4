// What zq3hist says on standard error.
#include "admin/zq3hist.h"

#include <cstdarg>
#include <cstring>

void putEscaped(FILE* out, const char* text, size_t length)
{
    for (size_t i = 0; i < length; i++) {
        unsigned char c = static_cast<unsigned char>(text[i]);
        if (c == '\n')
            fputs("\\n", out);
        else if (c == '\\')
            fputs("\\\\", out);
        else if (c < 0x20 || c > 0x7E)
            fprintf(out, "\\x%02X", c);
        else
            putc(c, out);
    }
}

static void say(const char* text)
{
    fputs("zq3hist: ", stderr);
    putEscaped(stderr, text, strlen(text));
    putc('\n', stderr);
}

int fail(const char* where, const char* format, ...)
{
    char what[2 * pathCapacity];
    char text[4 * pathCapacity];
    va_list arguments;
    va_start(arguments, format);
    vsnprintf(what, sizeof what, format, arguments);
    va_end(arguments);
    snprintf(text, sizeof text, "%s, %s", what, where);
    fflush(stdout);
    say(text);
    return exitFailed;
}

int failUsage(const char* format, ...)
{
    char text[2 * pathCapacity];
    va_list arguments;
    va_start(arguments, format);
    vsnprintf(text, sizeof text, format, arguments);
    va_end(arguments);
    say(text);
    fputs("Try 'zq3hist --help'.\n", stderr);
    return exitUsage;
}

// What a code means, and what an administrator does about it; %s is the place.
struct explanation {
    int code;
    const char* words;
    const char* advice;
};
static constexpr explanation explanations[] = {
    {HISTORY_FILE_DAMAGED, "the history is damaged",
     "zq3hist verify DIR names the damage; zq3hist repair DIR and zq3hist restore DIR FILE mend "
     "it"},
    {HISTORY_FILE_MISSING, "the directory holds no history file",
     "zq3hist load DIR FILE makes one"},
    {HISTORY_FILE_RECREATED,
     "neither file could be used; both were moved aside and an empty history was made",
     "zq3hist restore DIR FILE puts a backup in its place; the old files are zq3rhist.a and .b"},
    {sqloNLCKKeyFailure, "no lock key can be made of the history file",
     "it may be missing, or in a directory that may not be searched"},
    {sqloNLCKKeyConflict, "another program's semaphore set has the lock's key",
     "zq3hist status DIR shows the key, ipcs -s the set's owner; a copy of the directory has "
     "another key"},
    {sqloNLCKOwnerDied, "a process died while it held the lock",
     "zq3hist unlock DIR removes the lock; the next open settles what the process left unfinished"},
    {sqloNLCKBusy, "the lock is held by another process", nullptr},
    {END_OF_FILE, "the file is empty", nullptr},
    {DISK_FULL, "no space is left on the device", nullptr},
};

static const explanation* explanationOf(int code)
{
    for (const explanation& known : explanations)
        if (known.code == code)
            return &known;
    return nullptr;
}

const char* wordsForCode(int code)
{
    static char text[64];
    const explanation* known = explanationOf(code);
    if (known != nullptr)
        return known->words;
    if ((code & static_cast<int>(0xFFFF0000)) == sqloSystemError)
        return strerror(code & 0xFFFF);
    snprintf(text, sizeof text, "code %d (0x%08X)", code, static_cast<unsigned int>(code));
    return text;
}

int failWithCode(int code, const char* what, const char* where)
{
    fail(where, "cannot %s: %s", what, wordsForCode(code));
    const explanation* known = explanationOf(code);
    if (known != nullptr && known->advice != nullptr)
        fprintf(stderr, "zq3hist: hint: %s\n", known->advice);
    return exitFailed;
}
