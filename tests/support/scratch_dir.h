/*
 * scratch_dir.h - a fresh directory for one test under the system's
 * temporary directory, removed with all it holds when the test ends.
 */
#ifndef SCRATCH_DIR_H
#define SCRATCH_DIR_H

#include <cstdlib>
#include <filesystem>
#include <stdexcept>
#include <string>
#include <system_error>

class ScratchDir {
  public:
    // A directory named prefix-XXXXXX; a failure to make it fails the test that asked.
    explicit ScratchDir(const char *prefix) { make(prefix); }
    ~ScratchDir() { remove(); }
    ScratchDir(const ScratchDir &) = delete;
    ScratchDir &operator=(const ScratchDir &) = delete;

    const std::filesystem::path &path() const { return path_; }
    // renew - an empty directory in place of this one (under a new name, which path() then gives).
    void renew(const char *prefix) {
        remove();
        make(prefix);
    }

  private:
    void make(const char *prefix) {
        std::string tmpl = (std::filesystem::temp_directory_path() / (std::string(prefix) + "-XXXXXX")).string();
        if (!mkdtemp(tmpl.data()))
            throw std::runtime_error("mkdtemp failed for " + tmpl);
        path_ = tmpl;
    }
    void remove() {
        std::error_code ec;
        std::filesystem::remove_all(path_, ec);
    }

    std::filesystem::path path_;
};

#endif
