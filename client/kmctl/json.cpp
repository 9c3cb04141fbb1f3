/*
 * json.cpp - the JSON writer.
 */
#include "json.h"

#include <cstdio>

namespace kmctl {

void JsonWriter::newline() {
    out_ << '\n';
    for (size_t i = 0; i < frames_.size(); ++i)
        out_ << "  ";
}

void JsonWriter::before_value() {
    if (after_key_) {
        after_key_ = false;
        return;
    }
    if (frames_.empty())
        return;
    Frame &f = frames_.back();
    if (f.count++ > 0)
        out_ << (f.one_line ? ", " : ",");
    if (!f.one_line)
        newline();
}

void JsonWriter::end(char close) {
    Frame f = frames_.back();
    frames_.pop_back();
    if (f.count > 0 && !f.one_line)
        newline();
    out_ << close;
    if (frames_.empty())
        out_ << '\n';
}

JsonWriter &JsonWriter::begin_object() {
    before_value();
    out_ << '{';
    // Keys go on their own lines even inside a one-line array.
    frames_.push_back({false, 0});
    return *this;
}

JsonWriter &JsonWriter::end_object() {
    end('}');
    return *this;
}

JsonWriter &JsonWriter::begin_array(bool one_line) {
    before_value();
    out_ << '[';
    frames_.push_back({one_line, 0});
    return *this;
}

JsonWriter &JsonWriter::end_array() {
    end(']');
    return *this;
}

JsonWriter &JsonWriter::key(std::string_view name) {
    before_value();
    write_string(name);
    out_ << ": ";
    after_key_ = true;
    return *this;
}

JsonWriter &JsonWriter::value(std::string_view text) {
    before_value();
    write_string(text);
    return *this;
}

JsonWriter &JsonWriter::value(int64_t number) {
    before_value();
    out_ << number;
    return *this;
}

JsonWriter &JsonWriter::value(uint64_t number) {
    before_value();
    out_ << number;
    return *this;
}

JsonWriter &JsonWriter::value(bool flag) {
    before_value();
    out_ << (flag ? "true" : "false");
    return *this;
}

JsonWriter &JsonWriter::null() {
    before_value();
    out_ << "null";
    return *this;
}

void JsonWriter::write_string(std::string_view text) {
    out_ << '"';
    for (char c : text) {
        unsigned char u = static_cast<unsigned char>(c);
        switch (c) {
        case '"':
            out_ << "\\\"";
            break;
        case '\\':
            out_ << "\\\\";
            break;
        case '\n':
            out_ << "\\n";
            break;
        case '\r':
            out_ << "\\r";
            break;
        case '\t':
            out_ << "\\t";
            break;
        default:
            if (u < 0x20) {
                char esc[8] = {};
                std::snprintf(esc, sizeof esc, "\\u%04x", u);
                out_ << esc;
            } else {
                out_ << c; // UTF-8 passes through
            }
        }
    }
    out_ << '"';
}

} // namespace kmctl
