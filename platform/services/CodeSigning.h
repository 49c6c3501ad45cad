#pragma once

#include <memory>
#include <optional>
#include <string>

#include "platform/lum/AuditToken.h"
#include "platform/system/Error.h"
#include "platform/values/Value.h"

namespace platform {

/// What a process may do: a handle for entitlement queries. Usable from any thread.
class CodeSigningTask {
  public:
    struct Answer {
        std::optional<Value> value;
        std::optional<Error> error;  // the entitlements could not be read; told once
    };

    virtual ~CodeSigningTask() = default;
    /// The value of an entitlement; none when the process does not hold it.
    virtual Answer entitlement(const std::string& name) = 0;
};

class CodeSigning {
  public:
    virtual ~CodeSigning() = default;
    /// Reads what is asked for later: may hang with the file system of the process's executable.
    virtual std::unique_ptr<CodeSigningTask> makeTask(const AuditToken& token) = 0;
    /// The same without waiting for anybody, for a process whose executable lies in an open
    /// directory (borrowed, see `AuditToken::openFolderAtOnce`). Null when there is something to
    /// read.
    virtual std::unique_ptr<CodeSigningTask> makeTaskAtOnce(const AuditToken& token,
                                                            int folder) = 0;
};

/// Entitlements from files. A process's are those of `Entitlements.plist` of the bundle around its
/// executable, or of `<executable>.entitlements` beside an executable that lies in no bundle; read
/// when the task is made.
///
/// The file is trusted when it and every directory above it are owned by root or by this user and
/// writable by nobody else (a sticky directory passes); for a sandboxed process, only when all are
/// root's. From an untrusted file only "com.orbel.developer.zorvan.allowedplugins" counts, which
/// takes rights away. A process that is confined in any way that shows (`isConfined`) never holds
/// an entitlement that begins with "com.orbel.private.".
///
/// A missing file holds no entitlements. One that is there but cannot be read, is no regular file
/// or is no dictionary makes the first query an error and holds none; the restriction, which such a
/// file may have meant to set, then has a value that is no restriction, so that everything is
/// denied.
std::unique_ptr<CodeSigning> makeFileCodeSigning();

/// The task of a process whose entitlements could not be read in time: as of one with a file that
/// cannot be read.
std::unique_ptr<CodeSigningTask> makeUnreadableTask();

}  // namespace platform
