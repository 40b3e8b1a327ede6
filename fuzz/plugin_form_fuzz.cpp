// Rebuilding a plug-in record from an arbitrary form (text notation): no crash, and a record that
// set-up accepts exports and rebuilds again.
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "Annexa/AXPlugInCore.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    auto form = corvane::Value::parse(std::string_view(reinterpret_cast<const char*>(data), size));
    if (!form) return 0;
    auto record = annexa::AXPlugInCore::initWithForm(*form);
    if (!record) return 0;
    (void)record->diagnose();
    (void)record->isData();
    (void)record->isDedicated();
    record->updateFromForm(*form);
    auto exported = record->exportForm();
    if (!exported) return 0;
    auto again = annexa::AXPlugInCore::initWithForm(*exported);
    if (!again || !(*again == *record)) std::abort();
    return 0;
}
