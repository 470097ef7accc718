#include "TqovixReasons.h"

#include <cstring>
#include <new>
#include <string>

#include "../Reasons.h"
#include "engine/CTqovixMainFrame.h"

// The engine objects in here answer property queries only and never run a job, so no
// processing callback ever looks for an engine; this one stays hidden and empty, apart from
// the library's.
CTqovixMainFrame* g_pMainFrame = nullptr;

namespace {

// Cut at a character's start, so that what the host decodes as UTF-8 stays valid.
void Copy(const std::string& value, char* into, size_t size)
{
    if (into == nullptr || size == 0) {
        return;
    }
    size_t count = value.size();
    if (count >= size) {
        count = size - 1;
        while (count > 0 && (static_cast<unsigned char>(value[count]) & 0xC0) == 0x80) {
            --count;
        }
    }
    std::memcpy(into, value.data(), count);
    into[count] = '\0';
}

int Written(const Verdict& verdict, char* key, size_t keySize, char* text, size_t textSize)
{
    Copy(verdict.Key(), key, keySize);
    Copy(verdict.text, text, textSize);
    return verdict.Result();
}

// The words need memory; without it, the reason is that.
int OutOfMemory(char* key, size_t keySize, char* text, size_t textSize)
{
    Copy("out-of-memory", key, keySize);
    Copy("out of memory", text, textSize);
    return 100;
}

std::string Text(const char* path) { return path == nullptr ? std::string() : std::string(path); }

}  // namespace

int TqovixExplain(int code, const char* source, const char* destination, char* key, size_t keySize, char* text,
                  size_t textSize)
{
    try {
        return Written(Explain(code, Text(source), Text(destination)), key, keySize, text, textSize);
    } catch (const std::bad_alloc&) {
        return OutOfMemory(key, keySize, text, textSize);
    }
}

int TqovixCheckDestination(const char* source, const char* destination, int replace, char* key, size_t keySize,
                           char* text, size_t textSize)
{
    try {
        return Written(DestinationVerdict(Text(source), Text(destination), replace != 0), key, keySize, text,
                       textSize);
    } catch (const std::bad_alloc&) {
        return OutOfMemory(key, keySize, text, textSize);
    }
}

namespace {

const ReasonRow* Keyed(const char* key)
{
    for (const ReasonRow& row : ReasonTable()) {
        if (key != nullptr && std::strcmp(row.key, key) == 0) {
            return &row;
        }
    }
    return nullptr;
}

}  // namespace

int TqovixReasonWords(const char* key, char* text, size_t textSize)
{
    const ReasonRow* row = Keyed(key);
    if (row == nullptr) {
        Copy("", text, textSize);
        return -2;
    }
    try {
        // Through MakeVerdict, so that a slot for a detail is worded as the tool words it bare.
        Copy(MakeVerdict(row->code, row->reason).text, text, textSize);
    } catch (const std::bad_alloc&) {
        Copy("", text, textSize);
    }
    return row->code;
}

int TqovixAboutDestination(const char* key)
{
    const ReasonRow* row = Keyed(key);
    return row != nullptr && AboutDestination(row->reason) ? 1 : 0;
}
