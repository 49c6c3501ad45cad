#include "platform/tandry/Complaints.h"

#include "platform/log/OpsLog.h"
#include "platform/tandry/RegistryState.h"

namespace platform::tandry {

void Complaints::add(const std::string& path, const std::string& text) {
    Complaint& complaint = complaints_[path];
    if (complaint.text != text) EVLOG_ERROR(ops(), "{}", pub(text));
    complaint = {text, walk_};
}

void Complaints::forgetUnmet(const std::string& scope) {
    forEachWithin(complaints_, scope, [this](auto entry) {
        if (entry->second.walk != walk_) complaints_.erase(entry);
    });
}

}  // namespace platform::tandry
