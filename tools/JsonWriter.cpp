#include "JsonWriter.h"

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace qtools {

std::string JsonEscape(std::string_view s) {
    std::string out;
    out.reserve(s.size() + 2);
    for (unsigned char c : s) {
        switch (c) {
            case '"': out += "\\\""; break;
            case '\\': out += "\\\\"; break;
            case '\n': out += "\\n"; break;
            case '\r': out += "\\r"; break;
            case '\t': out += "\\t"; break;
            case '\b': out += "\\b"; break;
            case '\f': out += "\\f"; break;
            default:
                if (c < 0x20) {
                    char buf[8];
                    std::snprintf(buf, sizeof buf, "\\u%04x", c);
                    out += buf;
                } else {
                    out += static_cast<char>(c);
                }
        }
    }
    return out;
}

void JsonWriter::NewLine() {
    if (indent_ <= 0) return;
    out_ += '\n';
    out_.append(levels_.size() * static_cast<std::size_t>(indent_), ' ');
}

void JsonWriter::BeforeValue() {
    if (afterKey_) {
        afterKey_ = false;
        return;
    }
    if (levels_.empty()) return;
    if (!levels_.back().first) out_ += ',';
    levels_.back().first = false;
    NewLine();
}

void JsonWriter::Open(char c) {
    BeforeValue();
    out_ += c;
    levels_.push_back(Level{});
}

void JsonWriter::Close(char c) {
    const bool empty = levels_.empty() || levels_.back().first;
    if (!levels_.empty()) levels_.pop_back();
    if (!empty) NewLine();
    out_ += c;
}

JsonWriter& JsonWriter::BeginObject() { Open('{'); return *this; }
JsonWriter& JsonWriter::EndObject() { Close('}'); return *this; }
JsonWriter& JsonWriter::BeginArray() { Open('['); return *this; }
JsonWriter& JsonWriter::EndArray() { Close(']'); return *this; }

JsonWriter& JsonWriter::Key(std::string_view key) {
    BeforeValue();
    out_ += '"';
    out_ += JsonEscape(key);
    out_ += indent_ > 0 ? "\": " : "\":";
    afterKey_ = true;
    return *this;
}

JsonWriter& JsonWriter::String(std::string_view value) {
    BeforeValue();
    out_ += '"';
    out_ += JsonEscape(value);
    out_ += '"';
    return *this;
}

JsonWriter& JsonWriter::Number(double value, int decimals) {
    if (!std::isfinite(value)) return Null();
    BeforeValue();
    char buf[64];
    if (decimals >= 0) {
        std::snprintf(buf, sizeof buf, "%.*f", decimals, value);
    } else {
        // The shortest of 15 or 17 significant digits that reads back exactly.
        std::snprintf(buf, sizeof buf, "%.15g", value);
        if (std::strtod(buf, nullptr) != value) std::snprintf(buf, sizeof buf, "%.17g", value);
    }
    // A negative zero ("-0.0") is written as a plain zero.
    if (buf[0] == '-' && std::string_view(buf + 1).find_first_not_of("0.") == std::string_view::npos) {
        std::memmove(buf, buf + 1, std::strlen(buf));
    }
    out_ += buf;
    return *this;
}

JsonWriter& JsonWriter::Integer(int64_t value) {
    BeforeValue();
    out_ += std::to_string(value);
    return *this;
}

JsonWriter& JsonWriter::Unsigned(uint64_t value) {
    BeforeValue();
    out_ += std::to_string(value);
    return *this;
}

JsonWriter& JsonWriter::Bool(bool value) {
    BeforeValue();
    out_ += value ? "true" : "false";
    return *this;
}

JsonWriter& JsonWriter::Null() {
    BeforeValue();
    out_ += "null";
    return *this;
}

}  // namespace qtools
