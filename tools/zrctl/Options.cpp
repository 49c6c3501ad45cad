#include "tools/zrctl/Options.h"

#include <CLI/CLI.hpp>

#include <iostream>
#include <sstream>
#include <string>

#include "Zorvan/Keys.h"

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

constexpr const char* kPlugInFooter =
    R"(PLUGIN is the UUID of a plug-in (zrctl match --long shows it) or its identifier, when just one plug-in
has that; one that is excluded can only be named by its UUID. Plug-ins are changed in their order, up
to the first that the daemon does not know.

Exit status: 0 done; 1 no such plug-in; 2 wrong usage; 3 failure.)";

constexpr const char* kNamesFooter =
    R"(PLUGIN is the UUID of a plug-in, or its identifier, when just one plug-in has that.

Exit status: 0 done; 1 no such plug-in; 2 wrong usage; 3 failure.)";

constexpr const char* kRunFooter =
    R"(PLUGIN is the UUID of a plug-in, or its identifier, when just one plug-in has that. What comes from
standard input goes to the plug-in over its connection, what it answers to standard output. SIGINT and
SIGTERM end it.

Exit status: the plug-in's, or 128 and the number of the signal that ended it; 1 no such plug-in; 2 wrong
usage; 3 failure, with a line on standard error.)";

constexpr const char* kHoldFooter =
    R"(No plug-in of a hold is found by hosts, made ready or started; those that run go on. The token of the
hold is written at once; the hold is given back when SIGINT or SIGTERM comes, when the process ends in
any other way, or with "zrctl release TOKEN". The paths are taken together: all are held, or none.

Exit status: 0 held until interrupted; 2 wrong usage; 3 failure, or refused because plug-ins are busy,
which standard error names.)";

constexpr const char* kReleaseFooter =
    R"(A token of no hold (any more) is no failure.

Exit status: 0 done; 2 wrong usage; 3 failure.)";

constexpr const char* kAnnotateFooter =
    R"(An argument with "=" is a pair, every other one names a plug-in. VALUE is "true" or "false", which
become booleans, or a text; the same KEY given again makes a list. Other keys that the plug-ins have
stay, unless --replace is given: then the pairs are all that they have.

)";

constexpr const char* kExcludeFooter =
    R"(A rule is one or more KEY=PATTERN, as "zrctl match --help" explains; a plug-in that fits all of them is
excluded, whoever asks. "list" writes each rule on a line, as "remove" takes it. Nothing else in the
preferences is touched. The daemon need not run; it sees the change at its next match.

Exit status: 0 done; 1 no such rule, or none; 2 wrong usage; 3 failure.)";

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

void addElect(CLI::App& app, Options& options) {
    CLI::App* elect = app.add_subcommand("elect", "Choose which plug-ins are used");
    elect->footer(kPlugInFooter);
    const auto choose = [&options](const std::string& choice) {
        options.election = choice == "use" ? 1 : choice == "ignore" ? 2 : 0;
    };
    elect->add_option_function<std::string>("choice", choose, "What hosts shall do with them")
        ->check(CLI::IsMember({"use", "ignore", "default"}))
        ->type_name("CHOICE")
        ->required();
    elect->add_option("plugin", options.plugIns, "The plug-ins")->type_name("PLUGIN")->required();
    elect->callback([&options] { options.command = Options::Command::Elect; });
}

void addAnnotate(CLI::App& app, Options& options) {
    CLI::App* annotate =
        app.add_subcommand("annotate", "Keep data with plug-ins, in their annotation's extension");
    annotate->footer(std::string(kAnnotateFooter) + kPlugInFooter);
    annotate->add_option("argument", options.plugIns, "The plug-ins, and the data to keep")
        ->type_name("PLUGIN... KEY=VALUE...")
        ->required();
    annotate->add_flag("--replace", options.replace, "Drop the keys that are not given");
    annotate->callback([&options] { options.command = Options::Command::Annotate; });
}

void addWatch(CLI::App& app, Options& options) {
    app.add_subcommand("watch",
                       "Write a line whenever choices or holds have changed, until interrupted")
        ->callback([&options] { options.command = Options::Command::Watch; });
}

void addReady(CLI::App& app, Options& options, Options::Command command, const char* name,
              const char* help) {
    CLI::App* subcommand = app.add_subcommand(name, help);
    subcommand->footer(kNamesFooter);
    subcommand->add_option("plugin", options.plugIns, "The plug-ins")
        ->type_name("PLUGIN")
        ->required();
    subcommand->callback([&options, command] { options.command = command; });
}

void addRun(CLI::App& app, Options& options) {
    CLI::App* run = app.add_subcommand(
        "run", "Run a plug-in in its sandbox, connected with standard input and output");
    run->footer(kRunFooter);
    const auto name = [&options](const std::string& plugIn) { options.plugIns = {plugIn}; };
    run->add_option_function<std::string>("plugin", name, "The plug-in")
        ->type_name("PLUGIN")
        ->required();
    run->add_option("argument", options.arguments, "What it is given on its command line")
        ->type_name("-- ARGS");
    run->callback([&options] { options.command = Options::Command::Run; });
}

void addHold(CLI::App& app, Options& options) {
    CLI::App* hold = app.add_subcommand("hold", "Take plug-ins out of service, until interrupted");
    hold->footer(kHoldFooter);
    CLI::Option_group* kind = hold->add_option_group("kind");
    const auto flag = [&](const char* name, unsigned long value, const char* help) {
        kind->add_flag_callback(
            name, [&options, value] { options.flags = value; }, help);
    };
    flag("--app", zorvan::ZRHoldApplications,
         "The paths are applications, with all their plug-ins; refused while one is busy");
    flag("--plugin", zorvan::ZRHoldPlugIns, "The paths are plug-in bundles; busy or not");
    kind->require_option(1);
    hold->add_option("path", options.paths, "Applications, or plug-in bundles")
        ->type_name("PATH")
        ->required();
    hold->callback([&options] { options.command = Options::Command::Hold; });

    CLI::App* release = app.add_subcommand("release", "Give holds back");
    release->footer(kReleaseFooter);
    release->add_option("token", options.tokens, "What \"hold\" wrote")
        ->type_name("TOKEN")
        ->required();
    release->callback([&options] { options.command = Options::Command::Release; });
}

void addExclude(CLI::App& app, Options& options) {
    using Command = Options::Command;
    CLI::App* exclude =
        app.add_subcommand("exclude", "Edit the rules that take plug-ins out of every match");
    exclude->require_subcommand(1);
    exclude->footer(kExcludeFooter);
    const auto subcommand = [&](const char* name, Command command, const char* help) {
        CLI::App* one = exclude->add_subcommand(name, help);
        one->footer(kExcludeFooter);
        one->callback([&options, command] { options.command = command; });
        if (command == Command::ExcludeList) return;
        one->add_option("rule", options.rules, "The pairs of one rule")
            ->type_name("KEY=PATTERN")
            ->required();
    };
    subcommand("list", Command::ExcludeList, "List the rules");
    subcommand("add", Command::ExcludeAdd, "Add a rule, unless it is there");
    subcommand("remove", Command::ExcludeRemove, "Remove a rule");
}

}  // namespace

std::variant<Options, Outcome> Options::parse(int argc, const char* const* argv) {
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
    addElect(app, options);
    addAnnotate(app, options);
    addWatch(app, options);
    addReady(app, options, Command::Ready, "ready",
             "Tell whether plug-ins can be made ready for this process");
    addReady(app, options, Command::Access, "access",
             "Write a token for read access to each plug-in's bundle");
    addRun(app, options);
    addHold(app, options);
    addExclude(app, options);

    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& error) {
        std::ostringstream help;
        const int status = app.exit(error, help, std::cerr);
        return Outcome{status == 0 ? kDone : kUsageError, help.str(), {}};
    }
    return options;
}

}  // namespace zrctl
