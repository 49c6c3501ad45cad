// An activation overlay, the Info.plist and the entitlements of the bundle that it is for, and the
// administrator's settings. What is granted can be handed to the sandbox's program.
// Covers: platform/spawnerd/Allowance.cpp platform/spawnerd/Grant.cpp
// Covers: platform/spawnerd/SandboxProfile.cpp

#include "fuzz/Support.h"
#include "platform/spawnerd/Allowance.h"
#include "platform/spawnerd/Grant.h"
#include "platform/spawnerd/Launcher.h"
#include "platform/spawnerd/Protocol.h"
#include "platform/spawnerd/SandboxProfile.h"
#include "platform/system/Files.h"
#include "tests/support/KnownDirectory.h"

using namespace platform;
using namespace platform::spawnerd;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const Directories directories = fuzz::directories();
    static const std::string container = fuzz::home().makeDirectory("data/zorvan/Containers/a");
    static const std::string bundle = fuzz::home().makeDirectory("A.appex");
    static const std::string executable = fuzz::home().write("A.appex/run", "#!/bin/true\n");
    std::filesystem::permissions(executable, std::filesystem::perms::owner_all);

    const auto parts = fuzz::parts(fuzz::text(data, size), 4);
    fuzz::home().write("A.appex/Info.plist", parts[1]);
    fuzz::home().write("A.appex/Entitlements.plist", parts[2]);
    const auto settings = [all = fuzz::dictionaryIn(parts[3])](const std::string& key) {
        const Value* value = all.find(key);
        return value ? std::optional(*value) : std::nullopt;
    };
    const ExternalService service{executable, test::known(bundle), container};
    const auto grant = Grant::make(directories, service, fuzz::dictionaryIn(parts[0]));
    if (!grant) return 0;
    fuzz::require(isSafeName(grant->bundleIdentifier) && grant->profile);
    fuzz::require(grant->environment.size() <= kMaxStrings);
    const Surroundings surroundings{.allowance = allowanceFor(*grant, settings),
                                    .busyFolder = fuzz::home().makeDirectory("busy")};
    const auto setup = sandboxSetup(*grant, {}, directories, "zrd", surroundings);
    fuzz::require(bool(setup));
    for (const std::string& argument : setup->arguments)
        fuzz::require(argument.find('\0') == argument.npos);
    return 0;
}
