// Writing JSON. The writer minds the commas: what is put follows what was put before.
//
// key: the member's name; null for an element of a list and for what stands outside of everything.
// A byte of a text is the character with its number, so that any bytes make valid JSON and can be
// had back.
#pragma once

#include <cstddef>
#include <cstdio>

struct jsonWriter {
    FILE* out;
    bool comma; // something stands before in the object or list
};

// An object is begun and ended by '{' and '}', a list by '[' and ']'.
void beginJson(jsonWriter* json, const char* key, char bracket);
void endJson(jsonWriter* json, char bracket);

// Begins the object that answers a question, on standard output, with the version of its form.
void beginAnswer(jsonWriter* json);

// Ends the outermost object and its line; the next one stands for itself.
void endJsonLine(jsonWriter* json);

void putJsonBytes(jsonWriter* json, const char* key, const char* text, size_t length);
void putJsonText(jsonWriter* json, const char* key, const char* text); // terminated; null: null
void putJsonNumber(jsonWriter* json, const char* key, long long number);
void putJsonBool(jsonWriter* json, const char* key, bool value);
