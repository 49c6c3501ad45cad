#include "platform/tandry/Complaints.h"

#include "platform/log/OpsLog.h"
#include "platform/tandry/RegistryState.h"

namespace platform::tandry {

void Complaints::add(const std::string& path, const char* what, const std::string& which) {
    Complaint& complaint = complaints_[path];
    if (complaint.what != what || complaint.which != which) say(what, which);
    complaint = {what, which, walk_};
}

void Complaints::say(const char* what, const std::string& which) const {
    EVLOG_AT(level_, ops(), "{} {}", pub(what), which);
}

void Complaints::forgetUnmet(const std::string& scope) {
    forEachWithin(complaints_, scope, [this](auto entry) {
        if (entry->second.walk != walk_) complaints_.erase(entry);
    });
}

}  // namespace platform::tandry
