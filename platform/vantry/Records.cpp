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

}  // namespace

Value PlugInRecord::storedForm(bool withApplication) const {
    Value whole = serialize();
    Dictionary d = *whole.asDictionary();
    if (!withApplication) d.erase("application");
    const Value* own = info_.find("KSExtension");
    if (own && *own == plugin_) {
        Dictionary lean = *info_.asDictionary();
        lean.erase("KSExtension");
        d["info"] = Value(std::move(lean));
        d[kInfoLacksPlugIn] = Value(true);
    }
    return Value(std::move(d));
}

PlugInRecordPtr PlugInRecord::deserialize(const Value& v, ApplicationRecordPtr application) {
    auto uuid = UUID::parse(stringAt(v, "uuid").value_or(""));
    auto path = stringAt(v, "path");
    if (!uuid || !path) return nullptr;
    auto r = std::make_shared<PlugInRecord>();
    r->uuid_ = *uuid;
    r->bundlePath_ = *path;
    r->identifier_ = stringAt(v, "identifier").value_or("");
    r->bundleIdentifier_ = stringAt(v, "bundleIdentifier").value_or("");
    r->originalIdentifier_ = stringAt(v, "originalIdentifier").value_or("");
    r->bundleVersion_ = stringAt(v, "version").value_or("");
    r->plugin_ = v["plugin"];
    r->info_ = v["info"];
    if (v[kInfoLacksPlugIn].isTrue() && r->info_.isDictionary()) {
        Dictionary info = *r->info_.asDictionary();
        info.insert_or_assign("KSExtension", r->plugin_);
        r->info_ = Value(std::move(info));
    }
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
