#pragma once

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>

#include "Zorvan/ZRBundle.h"
#include "platform/lum/AuditToken.h"
#include "platform/values/Value.h"

namespace zorvan {

/// What admission and discovery need to know of a host: the process that asks.
class HostProcess {
  public:
    virtual ~HostProcess() = default;

    /// 0 when its connection is gone.
    virtual pid_t pid() const = 0;
    /// None when its connection is gone.
    virtual std::optional<platform::AuditToken> auditToken() const = 0;
    /// The executable; empty when it cannot be told.
    virtual const std::string& path() const = 0;
    /// The bundle around its executable, or a bundle made of the bare executable's own path; null
    /// when the executable cannot be told.
    virtual const std::shared_ptr<ZRBundle>& bundle() const = 0;
    /// The value of an entitlement, of any property-list type, or none.
    virtual std::optional<platform::Value> entitlementValueForKey(
        const std::string& name) const = 0;
    /// Whether it has the entitlement with a value that does not equal boolean false.
    virtual bool hasEntitlement(const std::string& name) const = 0;
};

}  // namespace zorvan
