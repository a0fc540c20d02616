#include "Support/Json.h"

#include <cstdlib>

namespace vsl::test {

namespace {

class Reader {
public:
    explicit Reader(const std::string& text) : s_(text) {}

    std::optional<Value> document(std::string* error) {
        auto v = value();
        space();
        if (v && at_ != s_.size()) fail("trailing characters");
        if (!why_.empty()) {
            if (error) *error = "at " + std::to_string(at_) + ": " + why_;
            return std::nullopt;
        }
        return v;
    }

private:
    std::optional<Value> fail(const char* why) {
        if (why_.empty()) why_ = why;
        return std::nullopt;
    }
    void space() {
        while (at_ < s_.size() && (s_[at_] == ' ' || s_[at_] == '\t' || s_[at_] == '\n' || s_[at_] == '\r')) at_++;
    }
    bool literal(const char* word) {
        std::string w(word);
        if (s_.compare(at_, w.size(), w) != 0) return false;
        at_ += w.size();
        return true;
    }

    std::optional<Value> value() {
        if (++depth_ > 64) return fail("nested too deeply");
        space();
        std::optional<Value> v;
        if (at_ >= s_.size()) return fail("unexpected end");
        char c = s_[at_];
        if (c == '{') v = object();
        else if (c == '[') v = array();
        else if (c == '"') {
            auto text = string();
            if (text) v = Value::string(*text);
        } else if (literal("true")) v = Value::boolean(true);
        else if (literal("false")) v = Value::boolean(false);
        else if (literal("null")) v = Value();
        else v = number();
        depth_--;
        return v;
    }

    std::optional<Value> number() {
        size_t start = at_;
        if (at_ < s_.size() && s_[at_] == '-') at_++;
        size_t digits = at_;
        while (at_ < s_.size() && s_[at_] >= '0' && s_[at_] <= '9') at_++;
        if (at_ == digits) return fail("expected a value");
        if (at_ < s_.size() && (s_[at_] == '.' || s_[at_] == 'e' || s_[at_] == 'E')) return fail("fractions are not used");
        std::string text = s_.substr(start, at_ - start);
        if (text[0] == '-') return Value::int64(std::strtoll(text.c_str(), nullptr, 10));
        unsigned long long n = std::strtoull(text.c_str(), nullptr, 10);
        return n > static_cast<unsigned long long>(INT64_MAX) ? Value::uint64(n) : Value::int64(static_cast<int64_t>(n));
    }

    std::optional<std::string> string() {
        at_++;  // the quote
        std::string out;
        while (at_ < s_.size() && s_[at_] != '"') {
            char c = s_[at_++];
            if (static_cast<unsigned char>(c) < 0x20) {
                fail("control character in a string");
                return std::nullopt;
            }
            if (c != '\\') {
                out += c;
                continue;
            }
            if (at_ >= s_.size()) break;
            char e = s_[at_++];
            switch (e) {
            case '"': case '\\': case '/': out += e; break;
            case 'b': out += '\b'; break;
            case 'f': out += '\f'; break;
            case 'n': out += '\n'; break;
            case 'r': out += '\r'; break;
            case 't': out += '\t'; break;
            case 'u': {
                if (at_ + 4 > s_.size()) break;
                unsigned code = std::strtoul(s_.substr(at_, 4).c_str(), nullptr, 16);
                at_ += 4;
                // UTF-8 of one code unit; the tools print no surrogate pairs.
                if (code < 0x80) out += static_cast<char>(code);
                else if (code < 0x800) {
                    out += static_cast<char>(0xC0 | (code >> 6));
                    out += static_cast<char>(0x80 | (code & 0x3F));
                } else {
                    out += static_cast<char>(0xE0 | (code >> 12));
                    out += static_cast<char>(0x80 | ((code >> 6) & 0x3F));
                    out += static_cast<char>(0x80 | (code & 0x3F));
                }
                break;
            }
            default: fail("bad escape"); return std::nullopt;
            }
        }
        if (at_ >= s_.size()) {
            fail("unterminated string");
            return std::nullopt;
        }
        at_++;
        return out;
    }

    std::optional<Value> array() {
        at_++;
        Array items;
        space();
        if (at_ < s_.size() && s_[at_] == ']') {
            at_++;
            return Value::array(std::move(items));
        }
        for (;;) {
            auto v = value();
            if (!v) return std::nullopt;
            items.push_back(*v);
            space();
            if (at_ < s_.size() && s_[at_] == ',') { at_++; continue; }
            if (at_ < s_.size() && s_[at_] == ']') { at_++; return Value::array(std::move(items)); }
            return fail("expected , or ]");
        }
    }

    std::optional<Value> object() {
        at_++;
        Dictionary d;
        space();
        if (at_ < s_.size() && s_[at_] == '}') {
            at_++;
            return Value::dictionary(std::move(d));
        }
        for (;;) {
            space();
            if (at_ >= s_.size() || s_[at_] != '"') return fail("expected a key");
            auto key = string();
            if (!key) return std::nullopt;
            space();
            if (at_ >= s_.size() || s_[at_] != ':') return fail("expected :");
            at_++;
            auto v = value();
            if (!v) return std::nullopt;
            if (d.count(*key)) return fail("duplicate key");
            d[*key] = *v;
            space();
            if (at_ < s_.size() && s_[at_] == ',') { at_++; continue; }
            if (at_ < s_.size() && s_[at_] == '}') { at_++; return Value::dictionary(std::move(d)); }
            return fail("expected , or }");
        }
    }

    const std::string& s_;
    size_t at_ = 0;
    int depth_ = 0;
    std::string why_;
};

}  // namespace

std::optional<Value> parseJson(const std::string& text, std::string* error) { return Reader(text).document(error); }

}  // namespace vsl::test
