/*
 * state_dir.h - where the TEE's persistent state lives, and how the
 * programs that run a TEE on it (an embedded kmctl, kmd) keep out of each
 * other's way.
 *
 * Two lock files sit in the state directory. "lock" is held exclusively by
 * whoever runs a TEE on the directory: an embedded kmctl for its whole
 * run, kmd while it starts. "kmd.lock" is held exclusively by the kmd
 * serving the directory for its whole life and names its socket; a kmctl
 * that gets "lock" and finds "kmd.lock" held refuses to start a TEE of its
 * own.
 */
#ifndef KM_STATE_DIR_H
#define KM_STATE_DIR_H

#include <filesystem>
#include <optional>
#include <string>

namespace km {

inline constexpr const char *kTeeLockFile = "lock";
inline constexpr const char *kKmdLockFile = "kmd.lock";

// default_state_dir - $KMCTL_STATE, else $XDG_STATE_HOME/kmctl (when
// absolute), else $HOME/.local/state/kmctl; empty when none is set.
std::filesystem::path default_state_dir();

// kmd_serving - when a kmd holds the state directory dir, the socket it
// named (empty while it has not named one yet); nullopt when none does.
// A lock file that cannot be read counts as held: a caller refusing to
// start a second TEE then errs on the safe side.
std::optional<std::string> kmd_serving(const std::filesystem::path &dir);

} // namespace km

#endif
