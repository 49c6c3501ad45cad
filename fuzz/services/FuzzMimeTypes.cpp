// The files of the database of MIME types, and questions, a pair of types a line.
// Covers: platform/services/Types.cpp

#include "fuzz/Support.h"
#include "platform/services/Types.h"

using namespace platform;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const Directories directories = fuzz::directories();
    const auto parts = fuzz::parts(fuzz::text(data, size), 3);
    fuzz::home().write("data/mime/aliases", parts[0]);
    fuzz::home().write("data/mime/subclasses", parts[1]);
    const auto types = makeMimeTypes(directories);
    std::string_view rest = parts[2];
    for (int i = 0; i < 16 && !rest.empty(); ++i) {
        const std::string_view line = rest.substr(0, rest.find('\n'));
        rest.remove_prefix(std::min(line.size() + 1, rest.size()));
        const std::size_t space = line.find(' ');
        const std::string type(line.substr(0, space));
        const std::string ancestor(space == line.npos ? "text/plain" : line.substr(space + 1));
        fuzz::require(types->conforms(type, type));
        fuzz::require(types->conforms(type, ancestor) == types->conforms(type, ancestor));
    }
    return 0;
}
