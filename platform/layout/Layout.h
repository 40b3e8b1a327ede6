// Where the platform keeps its files.
//
// Every platform path sits under one root. The environment variable CORVANE_ROOT moves that root,
// so that tests, benchmarks and the demo each run a whole private platform in a directory of their
// own; it is read on every call. Without it the ordinary places are used. docs/platform-layout.md
// lists every path.
//
// Thread-safety: every function is safe to call from any thread (the environment must not be
// changed while other threads run).
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

#include "platform/value/Value.h"

namespace corvane::layout {

// CORVANE_ROOT without a trailing slash, or "" when it is not set.
std::string root();

// The user's runtime directory: <root>/run/user/<uid>, or $XDG_RUNTIME_DIR, or /run/user/<uid>.
std::string runtimeDir();
// The user's home for platform data: <root>/home, or $HOME.
std::string homeDir();
// Per-user data: <root>/home/.local/share/corvane, or $XDG_DATA_HOME/corvane
// (default ~/.local/share/corvane).
std::string userDataDir();
// Per-user configuration: <root>/home/.config/corvane, or $XDG_CONFIG_HOME/corvane.
std::string userConfigDir();
// System-wide state: <root>/var/lib/corvane.
std::string stateDir();
// System-wide configuration: <root>/etc/corvane.
std::string configDir();
// Read-only shared data: <root>/usr/share/corvane.
std::string sharedDataDir();
// Per-user state: <root>/home/.local/state/corvane, or $XDG_STATE_HOME/corvane
// (default ~/.local/state/corvane).
std::string userStateDir();
// The system volume: <root>/usr. What packages install under it is system resident.
std::string systemRoot();
// Where packages install applications: <root>/usr/lib/corvane/Applications. The system registry
// holds what is there.
std::string systemApplicationsDir();
// Where a user installs applications: <per-user data>/Applications.
std::string userApplicationsDir();
// Whether `path` is `directory` or lies beneath it (by name; neither is resolved).
bool isBeneath(const std::string& path, const std::string& directory);
// Places a platform path (written as on a real system, "/var/db/...") under the root.
std::string underRoot(const std::string& absolutePath);

// Whether the platform's places can be used: CORVANE_ROOT, when set, is the absolute path of an
// existing directory; and, with `runtime`, without a root and without XDG_RUNTIME_DIR,
// /run/user/<uid> exists and belongs to the user (as a user manager makes it). The error says which
// variable and which path, and what to do. Programs check it when they start.
Status checkPlaces(bool runtime = true);

// Creates a directory and its missing parents with the given mode (existing ones are left as they
// are).
Status makeDirectories(const std::string& path, mode_t mode);

// The canonical form of an existing path (symbolic links, "." and ".." resolved), as realpath(3)
// gives it; nullopt with errno set when the path cannot be resolved.
std::optional<std::string> canonicalPath(const std::string& path);

}  // namespace corvane::layout
