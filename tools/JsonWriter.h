// A small streaming JSON writer: objects, arrays, strings with escaping,
// numbers (non-finite ones become null), booleans and null. Pretty-printed
// with an indent, or compact with indent 0.
#ifndef QUELTA_TOOLS_JSONWRITER_H
#define QUELTA_TOOLS_JSONWRITER_H

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace qtools {

std::string JsonEscape(std::string_view s);  // without the surrounding quotes

class JsonWriter {
public:
    explicit JsonWriter(int indent = 2) : indent_(indent) {}

    JsonWriter& BeginObject();
    JsonWriter& EndObject();
    JsonWriter& BeginArray();
    JsonWriter& EndArray();
    JsonWriter& Key(std::string_view key);
    JsonWriter& String(std::string_view value);
    // decimals < 0: as many digits as needed to read the value back.
    JsonWriter& Number(double value, int decimals = -1);
    JsonWriter& Integer(int64_t value);
    JsonWriter& Unsigned(uint64_t value);
    JsonWriter& Bool(bool value);
    JsonWriter& Null();

    const std::string& str() const { return out_; }

private:
    void BeforeValue();
    void Open(char c);
    void Close(char c);
    void NewLine();

    struct Level {
        bool first = true;
    };
    std::string out_;
    std::vector<Level> levels_;
    bool afterKey_ = false;
    int indent_;
};

}  // namespace qtools

#endif
