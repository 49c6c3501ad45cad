#include "tools/zrctl/Options.h"

#include <CLI/CLI.hpp>

#include "Zorvan/Keys.h"
#include "tools/zrctl/Outcome.h"

namespace zrctl {

namespace {

constexpr const char* kMatchFooter =
    R"(A rule is KEY=PATTERN; a plug-in must fit all of them. KEY is an attribute of the plug-in, a key
of its Info.plist, or one of VXExtensionPointIdentifier, VXExtensionIdentifier, VXUserElection,
VXExtensionContainingApp, com.orbel.uuid and ENTITLEMENT:<name>. PATTERN is a text, or an operator
and a text:
  KEY=1.2  KEY==1.2  KEY=<>1.2  KEY=<1.2  KEY=<=1.2  KEY=>1.2  KEY=>=1.2
  KEY=?UT-CONFORMS:text/plain    the value is that type or one that descends from it
  KEY=?UT-IS:text/html           the value is that type or one of its ancestors
  KEY=true  KEY=false            present and not false; absent or false
The same KEY given again adds an alternative. Quote rules with "<", ">" and "?" for the shell.

Exit status: 0 plug-ins found; 1 none found; 2 wrong usage; 3 failure.)";

constexpr const char* kFooter =
    "Exit status: 0 done, or plug-ins found; 1 none found; 2 wrong usage; 3 failure.";

void addMatch(CLI::App& app, Options& options) {
    CLI::App* match = app.add_subcommand(
        "match", "List the plug-ins that fit rules, of each identifier the newest version");
    match->footer(kMatchFooter);
    match->add_option("rule", options.rules, "What the plug-ins must be like")
        ->type_name("KEY=PATTERN");
    match
        ->add_option("--rules", options.rulesFile,
                     "Property list with a dictionary of rules; rules of the command line replace "
                     "its rules of the same key")
        ->type_name("FILE");

    const auto flag = [&](const char* name, unsigned long bit, const char* help) {
        match->add_flag_callback(
            name, [&options, bit] { options.flags |= bit; }, help);
    };
    flag("--all", zorvan::ZRDiscoverAll,
         "Also plug-ins that this caller could not use (for managers)");
    flag("--versions", zorvan::ZRDiscoverVersions, "Every version of each identifier");
    flag("--duplicates", zorvan::ZRDiscoverDuplicates,
         "With --versions: plug-ins of equal versions too");
    flag("--system-only", zorvan::ZRDiscoverSystemOnly, "Only plug-ins of the system volume");

    std::vector<CLI::Option*> formats;
    const auto format = [&](const char* name, Format value, const char* help) {
        CLI::Option* option = match->add_flag_callback(
            name, [&options, value] { options.format = value; }, help);
        for (CLI::Option* other : formats) option->excludes(other);
        formats.push_back(option);
    };
    format("--long", Format::Long, "Write all that people want to know of each plug-in");
    format("--json", Format::Json, "Write the plug-ins' forms as a JSON array");
    format("--plist", Format::PropertyList, "Write the plug-ins' forms as an XML property list");

    match->callback([&options] { options.command = Options::Command::Match; });
}

void addRegistration(CLI::App& app, Options& options, Options::Command command, const char* name,
                     const char* help) {
    CLI::App* subcommand = app.add_subcommand(name, help);
    subcommand->add_option("path", options.paths, "Plug-in bundle, or application")
        ->type_name("PATH")
        ->required();
    subcommand->callback([&options, command] { options.command = command; });
}

}  // namespace

std::variant<Options, int> Options::parse(int argc, const char* const* argv) {
    Options options;
    options.service = zorvan::kDefaultServiceName;

    CLI::App app("Asks zrd, the plug-in daemon, about plug-ins.", "zrctl");
    app.set_version_flag("--version", "zrctl " ZR_VERSION);
    app.add_option("-S,--service", options.service, "Name of the daemon's service")
        ->type_name("NAME")
        ->capture_default_str();
    app.require_subcommand(1);
    app.fallthrough();
    app.footer(kFooter);
    addMatch(app, options);
    addRegistration(app, options, Command::Add, "add",
                    "Register plug-in bundles, or applications with all their plug-ins");
    addRegistration(app, options, Command::Remove, "remove",
                    "Unregister plug-in bundles, or applications with all their plug-ins");

    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& error) {
        return app.exit(error) == 0 ? kDone : kUsageError;
    }
    return options;
}

}  // namespace zrctl
