// A strict minimal JSON reader for the tool tests: a whole document into a
// tree, or failure (duplicate keys, control characters, bad numbers).
#ifndef QUELTA_TESTS_TOOLS_PROBE_JSON_READER_H
#define QUELTA_TESTS_TOOLS_PROBE_JSON_READER_H

#include <cctype>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>
#include <map>
#include <string>
#include <vector>

namespace probejson {

struct Value {
    enum Kind { Null, Bool, Number, String, Array, Object } kind = Null;
    bool b = false;
    double n = 0.0;
    std::string s;
    std::vector<Value> items;
    std::map<std::string, Value> fields;

    bool has(const std::string& k) const { return kind == Object && fields.count(k) != 0; }
    const Value& operator[](const std::string& k) const { return fields.at(k); }
    const Value& operator[](std::size_t i) const { return items.at(i); }
};

class Parser {
public:
    explicit Parser(const std::string& text) : t_(text) {}
    bool Parse(Value& out) { return ParseValue(out) && (Space(), p_ == t_.size()); }

private:
    char At() const { return p_ < t_.size() ? t_[p_] : '\0'; }
    bool Eat(char c) { return At() == c && (++p_, true); }
    bool Digit() const { return isdigit(static_cast<unsigned char>(At())) != 0; }
    bool Digits() {  // one or more
        const std::size_t from = p_;
        while (Digit()) ++p_;
        return p_ > from;
    }
    void Space() { while (At() == ' ' || At() == '\n' || At() == '\r' || At() == '\t') ++p_; }
    bool Literal(const std::string& w) { return t_.compare(p_, w.size(), w) == 0 && (p_ += w.size(), true); }
    bool ParseString(std::string& out) {
        if (!Eat('"')) return false;
        while (p_ < t_.size() && t_[p_] != '"') {
            const char c = t_[p_++];
            if (static_cast<unsigned char>(c) < 0x20) return false;
            if (c != '\\') { out += c; continue; }
            const char e = At();
            ++p_;
            const char* plain = std::strchr("\"\\/bfnrt", e);
            if (e != '\0' && plain != nullptr) {
                out += "\"\\/\b\f\n\r\t"[plain - "\"\\/bfnrt"];
            } else if (e == 'u' && p_ + 4 <= t_.size()) {
                const long code = std::strtol(t_.substr(p_, 4).c_str(), nullptr, 16);
                p_ += 4;
                if (code >= 0x80) return false;  // the tools write ASCII escapes only
                out += static_cast<char>(code);
            } else {
                return false;
            }
        }
        return Eat('"');
    }
    // The items of an array or object, up to `close`.
    template <typename Item>
    bool Items(char close, Item item) {
        Space();
        if (Eat(close)) return true;
        do {
            Space();
            if (!item()) return false;
            Space();
        } while (Eat(','));
        return Eat(close);
    }
    bool ParseValue(Value& v) {
        Space();
        if (Eat('{')) {
            v.kind = Value::Object;
            return Items('}', [&] {
                std::string key;
                Value item;
                if (!ParseString(key) || (Space(), !Eat(':')) || !ParseValue(item)) return false;
                return v.fields.emplace(key, std::move(item)).second;  // duplicates fail
            });
        }
        if (Eat('[')) {
            v.kind = Value::Array;
            return Items(']', [&] { return v.items.emplace_back(), ParseValue(v.items.back()); });
        }
        if (At() == '"') return v.kind = Value::String, ParseString(v.s);
        if (Literal("true")) return v.kind = Value::Bool, v.b = true;
        if (Literal("false")) return v.kind = Value::Bool, true;
        if (Literal("null")) return true;
        // JSON's own number grammar: no '+', no bare '.', no leading zeros.
        const std::size_t start = p_;
        Eat('-');
        if (!Eat('0') && !Digits()) return false;
        if (Eat('.') && !Digits()) return false;
        if ((Eat('e') || Eat('E')) && (Eat('+') || Eat('-') || true) && !Digits()) return false;
        v.kind = Value::Number;
        v.n = std::strtod(t_.substr(start, p_ - start).c_str(), nullptr);
        return true;
    }

    const std::string& t_;
    std::size_t p_ = 0;
};

inline bool Parse(const std::string& text, Value& out) { return Parser(text).Parse(out); }

inline std::string ReadFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
}

}  // namespace probejson

#endif
