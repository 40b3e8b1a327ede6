#include "platform/containers/Containers.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/layout/Layout.h"

namespace corvane::containers {

namespace {

bool validName(const std::string& name) {
    return !name.empty() && name[0] != '.' && name.find('/') == std::string::npos &&
           name.find('\0') == std::string::npos;
}

Error invalid(const std::string& identifier) {
    return Error{kErrorDomain, kInvalidArgument, "invalid container class or identifier: " + identifier};
}

// One component beneath `dir`, never through a symbolic link: 0 with *out set, or the errno.
int openComponent(int dir, const std::string& name, int& out) {
    open_how how{};
    how.flags = O_PATH | O_DIRECTORY | O_CLOEXEC;
    how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS | RESOLVE_NO_XDEV;
    long fd = ::syscall(SYS_openat2, dir, name.c_str(), &how, sizeof how);
    if (fd < 0) return errno;
    out = static_cast<int>(fd);
    return 0;
}

}  // namespace

Result<OpenedDirectory> openBeneath(const OpenedDirectory& parent, const std::string& name, bool create) {
    if (!validName(name) || !parent.fd) return invalid(name);
    std::string path = parent.path + "/" + name;
    int fd = -1;
    int err = openComponent(parent.fd->get(), name, fd);
    if (err == ENOENT && create) {
        if (::mkdirat(parent.fd->get(), name.c_str(), 0700) != 0 && errno != EEXIST)
            return Error{kErrorDomain, kCannotCreate, "cannot create " + path + ": " + std::strerror(errno)};
        err = openComponent(parent.fd->get(), name, fd);
    }
    if (err == ELOOP) return Error{kErrorDomain, kSymbolicLink, "a symbolic link is where the directory " + path + " should be"};
    if (err == ENOTDIR) return Error{kErrorDomain, kCannotCreate, "a file that is no directory is at " + path};
    if (err == ENOENT) return Error{kErrorDomain, kNotFound, "no directory at " + path};
    if (err != 0) return Error{kErrorDomain, kCannotCreate, "cannot open " + path + ": " + std::strerror(err)};
    return OpenedDirectory{path, std::make_shared<FileDescriptor>(fd)};
}

Result<OpenedDirectory> openDataContainer(int containerClass, const std::string& identifier, bool create) {
    if (containerClass < 0 || !validName(identifier)) return invalid(identifier);
    // The containers root is the user's own, above every container: it is opened as it is.
    std::string root = layout::userDataDir() + "/containers";
    if (create) {
        if (Status made = layout::makeDirectories(root, 0700); !made.ok())
            return Error{kErrorDomain, kCannotCreate, "cannot create " + root + ": " + made.error().description()};
    }
    int fd = ::open(root.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0) return Error{kErrorDomain, create ? kCannotCreate : kNotFound, "cannot open " + root + ": " + std::strerror(errno)};
    OpenedDirectory containers{root, std::make_shared<FileDescriptor>(fd)};
    auto byClass = openBeneath(containers, std::to_string(containerClass), create);
    if (!byClass) return byClass.error();
    return openBeneath(*byClass, identifier, create);
}

Result<std::string> dataContainerPath(int containerClass, const std::string& identifier) {
    if (containerClass < 0 || !validName(identifier)) return invalid(identifier);
    return layout::userDataDir() + "/containers/" + std::to_string(containerClass) + "/" + identifier;
}

Result<std::string> lookupDataContainer(int containerClass, const std::string& identifier, bool create) {
    auto named = dataContainerPath(containerClass, identifier);
    if (!named) return named.error();
    const std::string& path = *named;
    struct stat st {};
    if (::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode)) return path;
    if (!create) return Error{kErrorDomain, kNotFound, "no container at " + path};
    if (Status made = layout::makeDirectories(path, 0700); !made.ok())
        return Error{kErrorDomain, kCannotCreate, "cannot create " + path + ": " + made.error().description()};
    return path;
}

}  // namespace corvane::containers
