// Per-user data containers: private directories, one per class and identifier, made with mode
// 0700 under <per-user data>/containers/<class>/<identifier>.
//
// Classes in use: 4, the data container of a plug-in (identifier: the plug-in's identifier);
// 10, the data container of a daemon (identifier: the daemon's name).
//
// Thread-safe.
#pragma once

#include <memory>
#include <string>

#include "platform/value/Value.h"

namespace corvane::containers {

inline constexpr const char* kErrorDomain = "com.corvane.containers";
inline constexpr int64_t kInvalidArgument = 22;
inline constexpr int64_t kNotFound = 2;
inline constexpr int64_t kCannotCreate = 5;

inline constexpr int kPlugInDataClass = 4;
inline constexpr int kDaemonDataClass = 10;

inline constexpr int64_t kSymbolicLink = 40;  // ELOOP: a symbolic link where a directory should be

// Where the container of this user is, whether or not it exists; nothing on disk is touched.
Result<std::string> dataContainerPath(int containerClass, const std::string& identifier);

// The container's path; with `create`, made when missing. Errors carry kErrorDomain and one of the
// codes above.
Result<std::string> lookupDataContainer(int containerClass, const std::string& identifier, bool create);

// A directory opened for the rules of a sandbox: its path and an O_PATH descriptor of it.
struct OpenedDirectory {
    std::string path;
    std::shared_ptr<FileDescriptor> fd;
};

// The container, opened without following a symbolic link anywhere below the user's containers
// root (a container is the plug-in's to change, so nothing in it is followed); with `create`, each
// missing directory is made (mode 0700) on the way. A symbolic link or another file where a
// directory should be is an error (kSymbolicLink, or kCannotCreate) naming the path.
Result<OpenedDirectory> openDataContainer(int containerClass, const std::string& identifier, bool create);
// The directory `name` (one component) in an opened directory, the same way.
Result<OpenedDirectory> openBeneath(const OpenedDirectory& parent, const std::string& name, bool create);

}  // namespace corvane::containers
