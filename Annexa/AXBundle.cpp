#include "Annexa/AXBundle.h"

namespace annexa {

namespace log = corvane::log;
using corvane::bundle::Bundle;

std::shared_ptr<AXBundle> AXBundle::initForMainBundle() { return initWithRPXBundle(Bundle::mainBundle()); }

std::shared_ptr<AXBundle> AXBundle::initWithURL(const std::string& url) { return initWithPath(url); }

std::shared_ptr<AXBundle> AXBundle::initWithPath(const std::string& path) {
    return initWithRPXBundle(Bundle::openPath(path));
}

std::shared_ptr<AXBundle> AXBundle::initWithExecutableURL(const std::string& url) {
    return initWithExecutablePath(url);
}

std::shared_ptr<AXBundle> AXBundle::initWithExecutablePath(const std::string& path) {
    auto bundle = Bundle::openExecutable(path);
    if (!bundle->property(corvane::bundle::kPropertyBundlePath)) bundle = Bundle::openPath(path);
    return initWithRPXBundle(std::move(bundle));
}

std::shared_ptr<AXBundle> AXBundle::initWithRPXBundle(std::shared_ptr<Bundle> bundle) {
    return std::shared_ptr<AXBundle>(new AXBundle(std::move(bundle)));
}

std::optional<std::string> AXBundle::stringProperty(int number) const {
    if (!bundle_) return std::nullopt;
    return bundle_->property(number);
}

std::optional<std::string> AXBundle::path() const {
    return stringProperty(corvane::bundle::kPropertyBundlePath);
}

std::optional<std::string> AXBundle::executablePath() const {
    auto exe = stringProperty(corvane::bundle::kPropertyExecutablePath);
    return exe ? exe : path();
}

std::optional<std::string> AXBundle::supportPath() const {
    corvane::MutexLock lock(mutex_);
    if (!supportPath_) supportPath_ = stringProperty(corvane::bundle::kPropertySupportPath);
    return supportPath_;
}

std::optional<std::string> AXBundle::bundleDirectory(const std::string& name) const {
    auto support = supportPath();
    if (!support) return std::nullopt;
    return *support + "/" + name;
}

Value AXBundle::infoDictionary() const {
    Value message = bundle_ ? bundle_->infoDictionary() : Value();
    if (message.isNull()) {
        log::info(logOps(), "failed to retrieve Info.plist for %@ through %@", path(), description());
        log::info(logOps(), "failed to convert Info.plist to dictionary: %@ source=%@", path(),
                  message.description());
        return Value();
    }
    return message;
}

std::optional<std::string> AXBundle::bundleIdentifier() const {
    if (!bundle_) return std::nullopt;
    Value info = bundle_->infoDictionary();
    if (const std::string* id = info["KFBundleIdentifier"].asString()) return *id;
    return std::nullopt;
}

std::optional<std::string> AXBundle::receiptPath() const {
    return bundle_ ? bundle_->receiptPath() : std::nullopt;
}

void AXBundle::flushBundleCaches() const {
    if (bundle_) bundle_->flush();
}

std::string AXBundle::description() const {
    return "<AXBundle " + (bundle_ ? bundle_->description() : std::string("(no bundle)")) + ">";
}

}  // namespace annexa
