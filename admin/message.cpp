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

int failForm(const commandLine* line)
{
    return failUsage("usage: zq3hist %s [OPTION...] %s", line->command->name, line->command->form);
}

// --- Hints ---------------------------------------------------------------------------------------

// Whether every shell takes the character for nothing but itself.
static bool isPlain(char c)
{
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
           (c != '\0' && strchr("/._-+:,@%", c) != nullptr);
}

// A word that the shell reads as this text. Bytes that a terminal might act upon are escaped.
static void putShellWord(FILE* out, const char* text)
{
    bool plain = true, printable = true;
    for (const char* c = text; *c != '\0'; c++) {
        plain = plain && isPlain(*c);
        printable = printable && *c >= 0x20 && *c <= 0x7E && *c != '\'';
    }
    if (plain || printable) {
        fprintf(out, plain ? "%s" : "'%s'", text);
        return;
    }
    fputs("$'", out);
    for (const char* c = text; *c != '\0'; c++)
        if (*c == '\'' || *c == '\\')
            fprintf(out, "\\%c", *c);
        else if (*c < 0x20 || *c > 0x7E)
            fprintf(out, "\\x%02X", static_cast<unsigned char>(*c));
        else
            putc(*c, out);
    putc('\'', out);
}

void hint(const historyPlace* place, const char* advice)
{
    static const char placeholder[] = "DIR";
    char path[2 * pathCapacity];
    fputs("zq3hist: hint: ", stderr);
    for (const char* at; (at = strstr(advice, placeholder)) != nullptr;) {
        fwrite(advice, 1, static_cast<size_t>(at - advice), stderr);
        advice = at + strlen(placeholder);
        size_t nameLength = 0;
        if (*advice == '/') {
            advice++; // the directory ends with one
            nameLength = strcspn(advice, " ");
        }
        snprintf(path, sizeof path, "%s%.*s", place->directory, static_cast<int>(nameLength),
                 advice);
        putShellWord(stderr, path);
        advice += nameLength;
    }
    fprintf(stderr, "%s\n", advice);
}

const char* entryWord(unsigned long long count)
{
    return count == 1 ? "entry" : "entries";
}

// --- Codes ---------------------------------------------------------------------------------------

// What a code means, and what an administrator does about it.
struct explanation {
    int code;
    int status;
    const char* words;
    const char* advice;
};
static constexpr explanation explanations[] = {
    {HISTORY_FILE_DAMAGED, exitDamaged, "the history is damaged",
     "zq3hist verify DIR  # names the damage and what mends it"},
    {HISTORY_FILE_MISSING, exitDamaged, "the directory holds no history file",
     "zq3hist restore DIR FILE  # FILE: a backup; without one, zq3hist load DIR FILE begins anew"},
    {sqloNLCKKeyFailure, exitFailed, "no lock key can be made of the history file",
     "ls -ld DIR DIR/" SQLUH_HISTORY_NAME "  # it may be missing or out of reach"},
    {sqloNLCKKeyConflict, exitLocked, "another program's semaphore set has the lock's key",
     "zq3hist status DIR; ipcs -s  # show the key, and the owner of the set with it"},
    {sqloNLCKOwnerDied, exitLocked, "a process died while it held the lock", unlockAdvice},
    {sqloNLCKBusy, exitLocked, "the lock is held by another process", nullptr},
    {sqloNLCKLost, exitLocked, "the lock was taken away meanwhile", nullptr},
    {sqloFileIncomplete, exitDamaged, "the image was not restored to its end",
     "zq3hist repair DIR  # goes on with the shadow"},
    {END_OF_FILE, exitDamaged, "the file is empty", nullptr},
    {DISK_FULL, exitFailed, "no space is left on the device", nullptr},
};

static const explanation* explanationOf(int code)
{
    for (const explanation& known : explanations)
        if (known.code == code)
            return &known;
    return nullptr;
}

bool isSystemCode(int code)
{
    return (code & static_cast<int>(0xFFFF0000)) == sqloSystemError &&
           explanationOf(code) == nullptr;
}

const char* wordsForCode(int code)
{
    static char text[64];
    const explanation* known = explanationOf(code);
    if (known != nullptr)
        return known->words;
    if (isSystemCode(code))
        return strerror(code & 0xFFFF);
    snprintf(text, sizeof text, "code %d (0x%08X)", code, static_cast<unsigned int>(code));
    return text;
}

int statusForCode(int code)
{
    const explanation* known = explanationOf(code);
    return known != nullptr ? known->status : exitFailed;
}

const char* wordsForStatus(int status)
{
    static const char* const words[] = {
        "done",
        "failed for a reason that has no number here",
        "wrong use",
        "the history is damaged or missing",
        "the lock: its owner died, or it is busy",
        "no such image",
        "a chain is incomplete",
    };
    static_assert(sizeof words / sizeof *words == exitIncomplete + 1);
    return words[status];
}

int failWithCode(int code, const char* what, const char* where)
{
    fail(where, "cannot %s: %s", what, wordsForCode(code));
    return statusForCode(code);
}

int failInPlace(int code, const char* what, const historyPlace* place)
{
    failWithCode(code, what, place->directory);
    const explanation* known = explanationOf(code);
    if (known != nullptr && known->advice != nullptr)
        hint(place, known->advice);
    return statusForCode(code);
}
