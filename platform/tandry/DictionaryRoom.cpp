#include "platform/tandry/DictionaryRoom.h"

namespace platform::tandry {

std::string DictionaryRoom::applicationOf(const TDPlugInProxy& record) {
    return record.containingApplication ? record.containingApplication->bundlePath : std::string();
}

void DictionaryRoom::count(const RegistryState& state) {
    applications_.clear();
    all_ = 0;
    for (const auto& [path, entry] : state.plugIns) add(entry);
}

void DictionaryRoom::add(const PlugInEntry& entry) {
    applications_[applicationOf(*entry.record)] += entry.dictionaries->size();
    all_ += entry.dictionaries->size();
}

void DictionaryRoom::remove(const PlugInEntry& entry) {
    applications_[applicationOf(*entry.record)] -= entry.dictionaries->size();
    all_ -= entry.dictionaries->size();
}

const char* DictionaryRoom::excess(const std::string& application, std::size_t size) const {
    const auto known = applications_.find(application);
    const std::size_t taken = known == applications_.end() ? 0 : known->second;
    if (!application.empty() && taken + size > kMaxApplicationSize)
        return "the dictionaries of its application's plug-ins would take over 32 MiB";
    return all_ + size > kMaxRegistrySize
               ? "the dictionaries of all plug-ins would take over 128 MiB"
               : nullptr;
}

}  // namespace platform::tandry
