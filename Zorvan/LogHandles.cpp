#include "Zorvan/LogHandles.h"

namespace zorvan {

namespace {

constexpr const char* kSubsystem = "com.orbel.Zorvan";

struct Handles {
    const platform::Log& ops = platform::Log::make(kSubsystem, "ops");
    const platform::Log& traffic = platform::Log::make(kSubsystem, "traffic");
    const platform::Log& extension = platform::Log::make(kSubsystem, "extension");
    const platform::Log& td = platform::Log::make(kSubsystem, "td");
};

const Handles& handles() {
    static const Handles made;
    return made;
}

}  // namespace

const platform::Log& ops() {
    return handles().ops;
}
const platform::Log& traffic() {
    return handles().traffic;
}
const platform::Log& extension() {
    return handles().extension;
}
const platform::Log& td() {
    return handles().td;
}

}  // namespace zorvan
