/*
 * json.h - a small streaming JSON writer for --json output: objects on
 * indented lines, arrays either indented or on one line.
 */
#ifndef KMCTL_JSON_H
#define KMCTL_JSON_H

#include <cstdint>
#include <ostream>
#include <string_view>
#include <vector>

namespace kmctl {

class JsonWriter {
public:
    // JsonWriter - writes to out, which must outlive the writer. The caller
    // balances every begin with its end; closing the outermost value ends
    // the line.
    explicit JsonWriter(std::ostream &out) : out_(out) {}

    // begin_object / end_object - an object, one member per line.
    JsonWriter &begin_object();
    JsonWriter &end_object();
    // begin_array - one_line keeps the elements on the array's own line.
    JsonWriter &begin_array(bool one_line = false);
    JsonWriter &end_array();
    // key - names the next value; only inside an object.
    JsonWriter &key(std::string_view name);
    // value / null - a scalar; strings are escaped, UTF-8 passes through.
    JsonWriter &value(std::string_view text);
    JsonWriter &value(const char *text) { return value(std::string_view(text)); }
    JsonWriter &value(int64_t number);
    JsonWriter &value(uint64_t number);
    JsonWriter &value(uint32_t number) { return value(uint64_t{number}); }
    JsonWriter &value(int32_t number) { return value(int64_t{number}); }
    JsonWriter &value(bool flag);
    JsonWriter &null();

private:
    struct Frame {
        bool one_line;
        size_t count;
    };
    void before_value();
    void end(char close);
    void newline();
    void write_string(std::string_view text);

    std::ostream &out_;
    std::vector<Frame> frames_;
    bool after_key_ = false;
};

} // namespace kmctl

#endif
