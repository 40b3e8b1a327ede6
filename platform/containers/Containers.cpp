#include "platform/containers/Containers.h"

#include <sys/stat.h>

#include <cerrno>

#include "platform/layout/Layout.h"

namespace corvane::containers {

Result<std::string> lookupDataContainer(int containerClass, const std::string& identifier, bool create) {
    if (containerClass < 0 || identifier.empty() || identifier[0] == '.' ||
        identifier.find('/') != std::string::npos || identifier.find('\0') != std::string::npos)
        return Error{kErrorDomain, kInvalidArgument, "invalid container class or identifier: " + identifier};
    std::string path =
        layout::userDataDir() + "/containers/" + std::to_string(containerClass) + "/" + identifier;
    struct stat st {};
    if (::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode)) return path;
    if (!create) return Error{kErrorDomain, kNotFound, "no container at " + path};
    if (Status made = layout::makeDirectories(path, 0700); !made.ok())
        return Error{kErrorDomain, kCannotCreate, "cannot create " + path + ": " + made.error().description()};
    return path;
}

}  // namespace corvane::containers
