/*
 * cli_files.h - what command-line tests share: a run's exit status and
 * captured output, and whole files read and written as bytes.
 */
#ifndef CLI_FILES_H
#define CLI_FILES_H

#include <cstdint>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

// CliRun - a child's exit status (-1 when it did not exit) and its output.
struct CliRun {
    int status = -1;
    std::string out;
    std::string err;
};

// slurp - a whole file; empty when it cannot be read.
inline std::string slurp(const std::filesystem::path &p) {
    std::ifstream in(p, std::ios::binary);
    std::ostringstream s;
    s << in.rdbuf();
    return s.str();
}

// spit - replaces a file with the bytes.
inline void spit(const std::filesystem::path &p, const std::vector<uint8_t> &data) {
    std::ofstream out(p, std::ios::binary | std::ios::trunc);
    out.write(reinterpret_cast<const char *>(data.data()), static_cast<std::streamsize>(data.size()));
}

#endif
