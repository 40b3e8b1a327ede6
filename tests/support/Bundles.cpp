#include "tests/support/Bundles.h"

#include <sys/stat.h>

#include <filesystem>

#include "platform/plist/Plist.h"
#include "tests/support/TestSupport.h"

namespace axtest {

std::string makeBundle(const std::string& parent, const std::string& name, const corvane::Value& info,
                       const std::string& executableSource) {
    std::string path = parent + "/" + name;
    std::filesystem::create_directories(path);
    if (!corvane::plist::writeXMLFile(path + "/Info.plist", info).ok()) std::abort();
    if (!executableSource.empty()) {
        const std::string* exe = info["KFBundleExecutable"].asString();
        std::string target = path + "/" + (exe ? *exe : "executable");
        std::filesystem::copy_file(executableSource, target,
                                   std::filesystem::copy_options::overwrite_existing);
        chmod(target.c_str(), 0755);
    }
    return path;
}

corvane::Value appInfo(const std::string& identifier, const std::string& executable) {
    return corvane::dict({{"KFBundleIdentifier", identifier},
                          {"KFBundleExecutable", executable},
                          {"KFBundleShortVersionString", "1.0"},
                          {"KFBundleVersion", "1"},
                          {"KFBundlePackageType", "APP!"}});
}

corvane::Value plugInInfo(const std::string& identifier, const corvane::Value& plugin,
                          const std::string& executable) {
    return corvane::dict({{"KFBundleIdentifier", identifier},
                          {"KFBundleExecutable", executable},
                          {"KFBundleShortVersionString", "1.0"},
                          {"KFBundleVersion", "1"},
                          {"KFBundlePackageType", "RPX!"},
                          {"KSExtension", plugin}});
}

}  // namespace axtest
