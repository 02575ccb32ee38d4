// Points in time as people write them.
#include "admin/zq3hist.h"

#include <cstring>

bool parseTimestamp(const char* text, char* timestamp)
{
    static const char readable[] = "dddd-dd-dd dd:dd:dd";
    size_t length = strlen(text), kept = 0;
    bool stored = length == timestampWidth;
    if (!stored && length != sizeof readable - 1)
        return false;
    for (size_t i = 0; i < length; i++) {
        bool isDigit = text[i] >= '0' && text[i] <= '9';
        if (stored || readable[i] == 'd') {
            if (!isDigit)
                return false;
            timestamp[kept++] = text[i];
        } else if (text[i] != readable[i] && !(readable[i] == ' ' && text[i] == 'T')) {
            return false;
        }
    }
    timestamp[kept] = '\0';
    return true;
}

static int twoDigits(const char* text)
{
    return 10 * (text[0] - '0') + (text[1] - '0');
}

bool isTime(const char* timestamp)
{
    static constexpr int days[] = {31, 29, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
    int century = twoDigits(timestamp), year = twoDigits(timestamp + 2);
    int month = twoDigits(timestamp + 4), day = twoDigits(timestamp + 6);
    bool leap = year % 4 == 0 && (year != 0 || century % 4 == 0);
    return month >= 1 && month <= 12 && day >= 1 && day <= days[month - 1] &&
           (month != 2 || day < 29 || leap) && twoDigits(timestamp + 8) < 24 &&
           twoDigits(timestamp + 10) < 60 && twoDigits(timestamp + 12) < 60;
}

int takeInstant(const char* what, const char* text, char* timestamp)
{
    if (parseTimestamp(text, timestamp))
        return 0;
    return failUsage("%s takes a timestamp such as 20250111010000 or '2025-01-11 01:00:00', not %s",
                     what, text);
}
