/*
 * delete.cpp - `kmctl delete`: retire one key blob (command 21) or all of
 * them (command 22). A blob is self-contained: the TA keeps no list of
 * keys, so deleting cannot revoke a copy; removing the file is what makes
 * this one unusable.
 */
#include <cerrno>
#include <cstring>
#include <memory>
#include <vector>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include "common.h"

namespace kmctl {
namespace {

struct DeleteOptions {
    std::string key;
    bool all = false;
    bool keep_file = false;
};

// Overwrites the blob's bytes in place before unlinking it, so that its
// content does not linger in the freed blocks of a simple file system.
void shred(const std::string &path) {
    int fd = ::open(path.c_str(), O_WRONLY | O_CLOEXEC);
    if (fd < 0)
        throw Failure(kExitLocal, "cannot remove " + path + ": " + std::strerror(errno));
    struct stat st {};
    int err = ::fstat(fd, &st) == 0 ? 0 : errno;
    if (!err && S_ISREG(st.st_mode)) {
        std::vector<uint8_t> zeros(static_cast<size_t>(st.st_size), 0);
        size_t done = 0;
        while (!err && done < zeros.size()) {
            ssize_t w = ::write(fd, zeros.data() + done, zeros.size() - done);
            if (w < 0 && errno == EINTR)
                continue;
            err = w < 0 ? errno : 0;
            done += w > 0 ? static_cast<size_t>(w) : 0;
        }
        if (!err && ::fsync(fd) != 0)
            err = errno;
    }
    ::close(fd);
    if (!err && S_ISREG(st.st_mode) && ::unlink(path.c_str()) != 0)
        err = errno;
    if (err)
        throw Failure(kExitLocal, "cannot remove " + path + ": " + std::strerror(err));
}

} // namespace

Command add_delete(CLI::App &kmctl, const GlobalOptions &options) {
    auto o = std::make_shared<DeleteOptions>();
    CLI::App *app = kmctl.add_subcommand(
        "delete", "Delete a key (--key BLOB: tell the TA, then overwrite and remove the file) or every key (--all)");
    CLI::Option *key = app->add_option("--key", o->key, "The key blob to delete (- for stdin)")->type_name("BLOB");
    CLI::Option *all = app->add_flag("--all", o->all, "Tell the TA to delete every key; no file is touched");
    CLI::Option *keep = app->add_flag("--keep-file", o->keep_file, "Keep the blob file after telling the TA");
    key->excludes(all);
    all->excludes(key);
    keep->excludes(all);
    return {app, [o, &options] {
                if (!o->all && o->key.empty())
                    usage_error("delete needs --key BLOB or --all");
                if (o->all) {
                    Session session(options);
                    check(session.client().delete_all_keys());
                    return;
                }
                km::Bytes blob = read_input(o->key);
                Session session(options);
                check(session.client().delete_key(blob));
                if (!o->keep_file && o->key != "-")
                    shred(o->key);
            }};
}

} // namespace kmctl
