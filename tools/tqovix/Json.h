// The one JSON writer of tqovix. Its text is always valid UTF-8: a byte that is not part of
// a well-formed UTF-8 sequence (a file name in another encoding) becomes U+FFFD.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

// `text` as a JSON string, quotes included.
std::string JsonString(const std::string& text);
// Items already in JSON, as an array.
std::string JsonArray(const std::vector<std::string>& items);

class JsonObject {
public:
    // The top-level object of every report carries the format's version first.
    static constexpr int kFormatVersion = 1;
    static JsonObject Report();

    JsonObject& Add(const std::string& key, const std::string& text);
    JsonObject& Add(const std::string& key, const char* text);
    JsonObject& Add(const std::string& key, bool value);
    JsonObject& Add(const std::string& key, int value) { return Add(key, static_cast<int64_t>(value)); }
    JsonObject& Add(const std::string& key, unsigned value) { return Add(key, static_cast<uint64_t>(value)); }
    JsonObject& Add(const std::string& key, int64_t value);
    JsonObject& Add(const std::string& key, uint64_t value);
    // Not a number (NaN, infinity) is written as null.
    JsonObject& Add(const std::string& key, double value, int decimals = 3);
    JsonObject& AddNull(const std::string& key);
    // `json` is already JSON: a nested object or an array.
    JsonObject& AddJson(const std::string& key, const std::string& json);

    std::string Text() const { return m_text + "}"; }

private:
    JsonObject& Member(const std::string& key, const std::string& json);
    std::string m_text = "{";
};
