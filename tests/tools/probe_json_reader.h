// A minimal JSON reader for the tool tests: parses a whole document into a
// tree, or fails. Enough to read back what the tools write.
#ifndef QUELTA_TESTS_TOOLS_PROBE_JSON_READER_H
#define QUELTA_TESTS_TOOLS_PROBE_JSON_READER_H

#include <cctype>
#include <cstdlib>
#include <fstream>
#include <map>
#include <memory>
#include <sstream>
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
    std::vector<std::string> order;  // keys in document order

    bool has(const std::string& k) const { return kind == Object && fields.count(k) != 0; }
    const Value& operator[](const std::string& k) const { return fields.at(k); }
    const Value& operator[](std::size_t i) const { return items.at(i); }
};

class Parser {
public:
    explicit Parser(const std::string& text) : t_(text) {}

    bool Parse(Value& out) {
        if (!ParseValue(out)) return false;
        Space();
        return p_ == t_.size();
    }

private:
    void Space() {
        while (p_ < t_.size() && (t_[p_] == ' ' || t_[p_] == '\n' || t_[p_] == '\r' || t_[p_] == '\t')) ++p_;
    }
    bool Literal(const char* word) {
        const std::string w(word);
        if (t_.compare(p_, w.size(), w) != 0) return false;
        p_ += w.size();
        return true;
    }
    bool ParseString(std::string& out) {
        if (p_ >= t_.size() || t_[p_] != '"') return false;
        ++p_;
        while (p_ < t_.size() && t_[p_] != '"') {
            char c = t_[p_++];
            if (static_cast<unsigned char>(c) < 0x20) return false;
            if (c == '\\') {
                if (p_ >= t_.size()) return false;
                const char e = t_[p_++];
                switch (e) {
                    case '"': out += '"'; break;
                    case '\\': out += '\\'; break;
                    case '/': out += '/'; break;
                    case 'n': out += '\n'; break;
                    case 'r': out += '\r'; break;
                    case 't': out += '\t'; break;
                    case 'b': out += '\b'; break;
                    case 'f': out += '\f'; break;
                    case 'u': {
                        if (p_ + 4 > t_.size()) return false;
                        const long code = std::strtol(t_.substr(p_, 4).c_str(), nullptr, 16);
                        p_ += 4;
                        if (code >= 0x80) return false;  // the tools write ASCII escapes only
                        out += static_cast<char>(code);
                        break;
                    }
                    default: return false;
                }
            } else {
                out += c;
            }
        }
        if (p_ >= t_.size()) return false;
        ++p_;
        return true;
    }
    bool ParseValue(Value& v) {
        Space();
        if (p_ >= t_.size()) return false;
        const char c = t_[p_];
        if (c == '{') {
            v.kind = Value::Object;
            ++p_;
            Space();
            if (p_ < t_.size() && t_[p_] == '}') return ++p_, true;
            for (;;) {
                Space();
                std::string key;
                if (!ParseString(key)) return false;
                Space();
                if (p_ >= t_.size() || t_[p_++] != ':') return false;
                Value item;
                if (!ParseValue(item)) return false;
                if (v.fields.count(key)) return false;  // duplicate key
                v.order.push_back(key);
                v.fields.emplace(key, std::move(item));
                Space();
                if (p_ < t_.size() && t_[p_] == ',') { ++p_; continue; }
                if (p_ < t_.size() && t_[p_] == '}') return ++p_, true;
                return false;
            }
        }
        if (c == '[') {
            v.kind = Value::Array;
            ++p_;
            Space();
            if (p_ < t_.size() && t_[p_] == ']') return ++p_, true;
            for (;;) {
                Value item;
                if (!ParseValue(item)) return false;
                v.items.push_back(std::move(item));
                Space();
                if (p_ < t_.size() && t_[p_] == ',') { ++p_; continue; }
                if (p_ < t_.size() && t_[p_] == ']') return ++p_, true;
                return false;
            }
        }
        if (c == '"') {
            v.kind = Value::String;
            return ParseString(v.s);
        }
        if (Literal("true")) { v.kind = Value::Bool; v.b = true; return true; }
        if (Literal("false")) { v.kind = Value::Bool; v.b = false; return true; }
        if (Literal("null")) { v.kind = Value::Null; return true; }
        // Number, in JSON's own grammar (no leading '+', no bare '.').
        const std::size_t start = p_;
        if (t_[p_] == '-') ++p_;
        if (p_ >= t_.size() || !isdigit(static_cast<unsigned char>(t_[p_]))) return false;
        if (t_[p_] == '0') ++p_; else while (p_ < t_.size() && isdigit(static_cast<unsigned char>(t_[p_]))) ++p_;
        if (p_ < t_.size() && t_[p_] == '.') {
            ++p_;
            if (p_ >= t_.size() || !isdigit(static_cast<unsigned char>(t_[p_]))) return false;
            while (p_ < t_.size() && isdigit(static_cast<unsigned char>(t_[p_]))) ++p_;
        }
        if (p_ < t_.size() && (t_[p_] == 'e' || t_[p_] == 'E')) {
            ++p_;
            if (p_ < t_.size() && (t_[p_] == '+' || t_[p_] == '-')) ++p_;
            if (p_ >= t_.size() || !isdigit(static_cast<unsigned char>(t_[p_]))) return false;
            while (p_ < t_.size() && isdigit(static_cast<unsigned char>(t_[p_]))) ++p_;
        }
        v.kind = Value::Number;
        v.n = std::strtod(t_.substr(start, p_ - start).c_str(), nullptr);
        return true;
    }

    const std::string& t_;
    std::size_t p_ = 0;
};

inline bool Parse(const std::string& text, Value& out) { return Parser(text).Parse(out); }

inline std::string ReadFile(const std::string& path) {
    std::ifstream f(path, std::ios::binary);
    std::stringstream ss;
    ss << f.rdbuf();
    return ss.str();
}

}  // namespace probejson

#endif
