// A small JSON writer for the command's --json output: values are appended
// to one string in document order; the writer tracks commas.
#ifndef OXIDM_TOOL_JSON_H
#define OXIDM_TOOL_JSON_H

#include <cstdint>
#include <cstdio>
#include <string>
#include <string_view>
#include <vector>

namespace oxidm_tool {

class Json {
  public:
    Json &begin_object(std::string_view key = {}) { return open(key, '{'); }
    Json &end_object() { return close('}'); }
    Json &begin_array(std::string_view key = {}) { return open(key, '['); }
    Json &end_array() { return close(']'); }
    Json &str(std::string_view key, std::string_view value) {
        name(key);
        quote(value);
        return *this;
    }
    Json &num(std::string_view key, int64_t value) {
        name(key);
        out_ += std::to_string(value);
        return *this;
    }
    Json &boolean(std::string_view key, bool value) {
        name(key);
        out_ += value ? "true" : "false";
        return *this;
    }
    Json &null(std::string_view key) {
        name(key);
        out_ += "null";
        return *this;
    }
    // A text or null when absent.
    Json &opt(std::string_view key, const char *value) { return value ? str(key, value) : null(key); }
    const std::string &text() const { return out_; }
    void print(FILE *f = stdout) const { std::fprintf(f, "%s\n", out_.c_str()); }

  private:
    Json &open(std::string_view key, char c) {
        name(key);
        out_ += c;
        first_.push_back(true);
        return *this;
    }
    Json &close(char c) {
        out_ += c;
        first_.pop_back();
        return *this;
    }
    // Writes the separator and, inside an object, the key.
    void name(std::string_view key) {
        if (!first_.empty()) {
            if (!first_.back()) out_ += ',';
            first_.back() = false;
        }
        if (!key.empty()) {
            quote(key);
            out_ += ':';
        }
    }
    void quote(std::string_view s) {
        out_ += '"';
        for (unsigned char c : s) {
            switch (c) {
                case '"': out_ += "\\\""; break;
                case '\\': out_ += "\\\\"; break;
                case '\n': out_ += "\\n"; break;
                case '\r': out_ += "\\r"; break;
                case '\t': out_ += "\\t"; break;
                default:
                    if (c < 0x20) {
                        char buf[8];
                        std::snprintf(buf, sizeof buf, "\\u%04x", c);
                        out_ += buf;
                    } else if (c >= 0x80) {
                        // Bytes are not assumed to be UTF-8: anything above
                        // ASCII is written as the code point of the same value.
                        char buf[8];
                        std::snprintf(buf, sizeof buf, "\\u%04x", c);
                        out_ += buf;
                    } else {
                        out_ += static_cast<char>(c);
                    }
            }
        }
        out_ += '"';
    }
    std::string out_;
    std::vector<bool> first_;
};

}  // namespace oxidm_tool

#endif
