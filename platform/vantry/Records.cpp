// The records: immutable snapshots, and their serialized form (the database and the journal).
#include "platform/vantry/Store.h"

namespace corvane::vantry {

Value PlugInRecord::lookup(Scope scope, std::string_view key) const {
    switch (scope) {
        case Scope::Attributes: return plugin_["KSExtensionAttributes"][key];
        case Scope::PlugIn: return plugin_[key];
        case Scope::InfoPlist: return info_[key];
    }
    return Value();
}

Value ApplicationRecord::serialize() const {
    Dictionary d{{"path", bundlePath_}, {"identifier", identifier_}, {"placeholder", placeholder_}};
    if (localizedName_) d.emplace("name", *localizedName_);
    if (receipt_) d.emplace("receipt", *receipt_);
    return Value(std::move(d));
}

std::vector<PlugInRecordPtr> ApplicationRecord::plugIns() const {
    return plugIns_ ? plugIns_() : std::vector<PlugInRecordPtr>{};
}

std::string ApplicationRecord::description() const { return "<application " + identifier_ + " " + bundlePath_ + ">"; }

Value PlugInRecord::serialize() const {
    Dictionary d{{"uuid", uuid_.string()},       {"path", bundlePath_},
                 {"identifier", identifier_},    {"bundleIdentifier", bundleIdentifier_},
                 {"originalIdentifier", originalIdentifier_}, {"version", bundleVersion_},
                 {"plugin", plugin_},            {"info", info_},
                 {"entitlements", entitlements_}, {"registered", Value(registered_)},
                 {"system", system_}};
    if (container_) d.emplace("container", *container_);
    if (localizedName_) d.emplace("name", *localizedName_);
    if (localizedShortName_) d.emplace("shortName", *localizedShortName_);
    if (application_) d.emplace("application", application_->serialize());
    return Value(std::move(d));
}

namespace {

// The mark of an Info.plist stored without its plug-in dictionary ("KSExtension").
constexpr const char* kInfoLacksPlugIn = "infoLacksPlugIn";

// What reading derives for the fields a stored form leaves out when they are so.
std::string infoText(const Value& info, const char* key) { return stringAt(info, key).value_or(""); }
std::string originalIdentifierOf(const std::string& bundleIdentifier, const std::string& identifier) {
    return bundleIdentifier.empty() ? identifier : bundleIdentifier;
}

}  // namespace

Value PlugInRecord::storedForm(StoredIn where) const {
    Value whole = serialize();
    Dictionary d = *whole.asDictionary();
    if (where == StoredIn::Table)
        for (const char* key : {"application", "uuid", "path", "identifier"}) d.erase(key);
    d.erase("container");
    if (bundleIdentifier_ == infoText(info_, "KFBundleIdentifier")) d.erase("bundleIdentifier");
    if (bundleVersion_ == infoText(info_, "KFBundleVersion")) d.erase("version");
    if (originalIdentifier_ == originalIdentifierOf(bundleIdentifier_, identifier_)) d.erase("originalIdentifier");
    const Value* own = info_.find("KSExtension");
    if (own && *own == plugin_) {
        Dictionary lean = *info_.asDictionary();
        lean.erase("KSExtension");
        d["info"] = Value(std::move(lean));
        d[kInfoLacksPlugIn] = Value(true);
    }
    return Value(std::move(d));
}

PlugInRecordPtr PlugInRecord::deserialize(const Value& v, ApplicationRecordPtr application, const Columns& columns) {
    return read(v, std::move(application), columns);
}

std::shared_ptr<PlugInRecord> PlugInRecord::read(const Value& v, ApplicationRecordPtr application,
                                                 const Columns& columns) {
    auto text = [&](const char* key, std::string_view column) {
        auto stored = stringAt(v, key);
        return stored ? *stored : std::string(column);
    };
    auto uuid = UUID::parse(text("uuid", columns.uuid));
    std::string path = text("path", columns.path);
    if (!uuid || path.empty()) return nullptr;
    auto r = std::make_shared<PlugInRecord>();
    r->uuid_ = *uuid;
    r->bundlePath_ = std::move(path);
    r->identifier_ = text("identifier", columns.identifier);
    r->plugin_ = v["plugin"];
    r->info_ = v["info"];
    if (v[kInfoLacksPlugIn].isTrue() && r->info_.isDictionary()) {
        Dictionary info = *r->info_.asDictionary();
        info.insert_or_assign("KSExtension", r->plugin_);
        r->info_ = Value(std::move(info));
    }
    r->bundleIdentifier_ = stringAt(v, "bundleIdentifier").value_or(infoText(r->info_, "KFBundleIdentifier"));
    r->bundleVersion_ = stringAt(v, "version").value_or(infoText(r->info_, "KFBundleVersion"));
    r->originalIdentifier_ =
        stringAt(v, "originalIdentifier").value_or(originalIdentifierOf(r->bundleIdentifier_, r->identifier_));
    r->entitlements_ = v["entitlements"].isDictionary() ? v["entitlements"] : Value(Dictionary{});
    if (const Date* d = v["registered"].asDate()) r->registered_ = *d;
    r->system_ = v["system"].isTrue();
    r->container_ = stringAt(v, "container");
    r->localizedName_ = stringAt(v, "name");
    r->localizedShortName_ = stringAt(v, "shortName");
    if (!application && v.has("application")) {
        // An application as it was (the journal's copy): no live plug-in list.
        const Value& a = v["application"];
        auto app = std::make_shared<ApplicationRecord>();
        app->bundlePath_ = stringAt(a, "path").value_or("");
        app->identifier_ = stringAt(a, "identifier").value_or("");
        app->localizedName_ = stringAt(a, "name");
        app->receipt_ = stringAt(a, "receipt");
        app->placeholder_ = a["placeholder"].isTrue();
        application = app;
    }
    r->application_ = std::move(application);
    return r;
}

std::string PlugInRecord::description() const {
    return "<plug-in " + identifier_ + " " + uuid_.string() + " " + bundlePath_ + ">";
}

}  // namespace corvane::vantry
