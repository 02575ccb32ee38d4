#include "admin/json.h"

#include <cstring>

static void putPlace(jsonWriter* json, const char* key)
{
    if (json->comma)
        putc(',', json->out);
    if (key != nullptr)
        fprintf(json->out, "\"%s\":", key);
    json->comma = true;
}

void beginJson(jsonWriter* json, const char* key, char bracket)
{
    putPlace(json, key);
    putc(bracket, json->out);
    json->comma = false;
}

void endJson(jsonWriter* json, char bracket)
{
    putc(bracket, json->out);
    json->comma = true;
}

void beginAnswer(jsonWriter* json)
{
    *json = {stdout, false};
    beginJson(json, nullptr, '{');
    putJsonNumber(json, "format", 1);
}

void endJsonLine(jsonWriter* json)
{
    fputs("}\n", json->out);
    json->comma = false;
}

void putJsonBytes(jsonWriter* json, const char* key, const char* text, size_t length)
{
    putPlace(json, key);
    putc('"', json->out);
    for (size_t i = 0; i < length; i++) {
        unsigned char c = static_cast<unsigned char>(text[i]);
        if (c == '"' || c == '\\')
            fprintf(json->out, "\\%c", c);
        else if (c < 0x20 || c > 0x7E)
            fprintf(json->out, "\\u%04X", c);
        else
            putc(c, json->out);
    }
    putc('"', json->out);
}

void putJsonText(jsonWriter* json, const char* key, const char* text)
{
    if (text != nullptr) {
        putJsonBytes(json, key, text, strlen(text));
    } else {
        putPlace(json, key);
        fputs("null", json->out);
    }
}

void putJsonNumber(jsonWriter* json, const char* key, long long number)
{
    putPlace(json, key);
    fprintf(json->out, "%lld", number);
}

void putJsonBool(jsonWriter* json, const char* key, bool value)
{
    putPlace(json, key);
    fputs(value ? "true" : "false", json->out);
}
