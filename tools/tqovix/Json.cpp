#include "Json.h"

#include <cinttypes>
#include <cmath>
#include <cstdio>

namespace {

// Length of the well-formed UTF-8 sequence at `at`, or 0 when its first byte starts none
// (stray continuation, overlong form, surrogate, beyond U+10FFFF, cut short).
size_t SequenceLength(const std::string& text, size_t at)
{
    const auto byte = [&](size_t i) { return at + i < text.size() ? static_cast<unsigned char>(text[at + i]) : 0; };
    const unsigned char lead = byte(0);
    const auto continuation = [&](size_t i) { return (byte(i) & 0xC0) == 0x80; };
    if (lead < 0x80) {
        return 1;
    }
    if (lead >= 0xC2 && lead <= 0xDF) {
        return continuation(1) ? 2 : 0;
    }
    if (lead >= 0xE0 && lead <= 0xEF) {
        const unsigned char second = byte(1);
        const bool valid = continuation(1) && continuation(2) && !(lead == 0xE0 && second < 0xA0) &&
                           !(lead == 0xED && second >= 0xA0);
        return valid ? 3 : 0;
    }
    if (lead >= 0xF0 && lead <= 0xF4) {
        const unsigned char second = byte(1);
        const bool valid = continuation(1) && continuation(2) && continuation(3) && !(lead == 0xF0 && second < 0x90) &&
                           !(lead == 0xF4 && second >= 0x90);
        return valid ? 4 : 0;
    }
    return 0;
}

}  // namespace

std::string JsonString(const std::string& text)
{
    std::string quoted = "\"";
    for (size_t at = 0; at < text.size();) {
        const size_t length = SequenceLength(text, at);
        if (length == 0) {
            quoted += "\xEF\xBF\xBD";
            ++at;
            continue;
        }
        const char c = text[at];
        if (length > 1) {
            quoted.append(text, at, length);
        } else if (c == '"' || c == '\\') {
            quoted += '\\';
            quoted += c;
        } else if (c == '\n') {
            quoted += "\\n";
        } else if (c == '\t') {
            quoted += "\\t";
        } else if (static_cast<unsigned char>(c) < 0x20 || c == 0x7F) {
            char escaped[8];
            std::snprintf(escaped, sizeof escaped, "\\u%04x", static_cast<unsigned>(static_cast<unsigned char>(c)));
            quoted += escaped;
        } else {
            quoted += c;
        }
        at += length;
    }
    return quoted + "\"";
}

std::string JsonArray(const std::vector<std::string>& items)
{
    std::string array = "[";
    for (size_t i = 0; i < items.size(); ++i) {
        array += (i != 0 ? "," : "") + items[i];
    }
    return array + "]";
}

JsonObject JsonObject::Report()
{
    JsonObject report;
    report.Add("version", kFormatVersion);
    return report;
}

JsonObject& JsonObject::Member(const std::string& key, const std::string& json)
{
    if (m_text.size() > 1) {
        m_text += ',';
    }
    m_text += JsonString(key);
    m_text += ':';
    m_text += json;
    return *this;
}

JsonObject& JsonObject::Add(const std::string& key, const std::string& text) { return Member(key, JsonString(text)); }
JsonObject& JsonObject::Add(const std::string& key, const char* text)
{
    return text == nullptr ? AddNull(key) : Member(key, JsonString(text));
}
JsonObject& JsonObject::Add(const std::string& key, bool value) { return Member(key, value ? "true" : "false"); }
JsonObject& JsonObject::Add(const std::string& key, int64_t value) { return Member(key, std::to_string(value)); }
JsonObject& JsonObject::Add(const std::string& key, uint64_t value) { return Member(key, std::to_string(value)); }
JsonObject& JsonObject::AddNull(const std::string& key) { return Member(key, "null"); }
JsonObject& JsonObject::AddJson(const std::string& key, const std::string& json) { return Member(key, json); }

JsonObject& JsonObject::Add(const std::string& key, double value, int decimals)
{
    if (!std::isfinite(value)) {
        return AddNull(key);
    }
    char text[64];
    std::snprintf(text, sizeof text, "%.*f", decimals, value);
    return Member(key, text);
}
