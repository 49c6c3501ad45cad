// The commands of zrctl that change things, over the real daemon.

#include <csignal>

#include "platform/plist/PropertyList.h"
#include "tests/system/SystemTest.h"

namespace test {

namespace {

using testing::AllOf;
using testing::HasSubstr;

class Zrctl : public SystemTest {
  protected:
    Zrctl() {
        for (const char* name : {"one", "two", "three"})
            writePlugIn(plugInPath("A", name), info(name));
        writePlist(std::string(kApps) + "A.app/Info.plist",
                   Dictionary{{"QFBundleIdentifier", "A"}});
        writePlugIn(plugInPath("A", "newer"), info("two", "1.10"));
    }

    /// The exit status and what is said about it.
    std::string run(std::vector<std::string> arguments) {
        const auto process = zrctl(std::move(arguments));
        return std::to_string(process->wait()) + ' ' + process->err();
    }
    Dictionary plugIn(const char* identifier) {
        return forms({{"VXExtensionIdentifier", identifier}}).at(0);
    }
    Value annotations(const char* identifier) {
        return *plugIn(identifier).find(zorvan::form::kAnnotations);
    }
};

TEST_F(Zrctl, ChoicesReachThePlugInsThatAreNamed) {
    start();
    EXPECT_EQ(run({"elect", "use", "one", plugIn("two").find("uuid")->string()->string()}), "0 ");
    EXPECT_EQ(annotations("one"), Value(Dictionary{{"election", 1}}));
    EXPECT_EQ(annotations("two"), Value(Dictionary{{"election", 1}}));
    EXPECT_EQ(run({"elect", "ignore", "one"}), "0 ");
    EXPECT_EQ(annotations("one"), Value(Dictionary{{"election", 2}}));

    EXPECT_THAT(run({"elect", "default", "one", "two"}),
                AllOf(HasSubstr("3 zrctl: two names 2 plug-ins"),
                      HasSubstr("(version 1.10, " + home_.path()), HasSubstr("; "),
                      HasSubstr(*plugIn("two").find("uuid")->string())));
    EXPECT_EQ(run({"elect", "default", "one", "none"}), "1 zrctl: no such plug-in: none\n");
    EXPECT_EQ(annotations("one"), Value(Dictionary{{"election", 2}})) << "none is changed";
    const std::string unknown = "5DD40623-E747-4F9F-AAEA-DED2357E23FB";
    EXPECT_EQ(run({"elect", "use", unknown}), "1 zrctl: no such plug-in: " + unknown + "\n");
    EXPECT_THAT(run({"-S", "nobody", "elect", "use", unknown}), HasSubstr("3 zrctl: zrd is not"));
}

TEST_F(Zrctl, WhatCannotBeWrittenLeavesTheStatus) {
    start();
    const auto inShell = [&](const std::string& rest) {
        const auto shell = spawn("/bin/sh", {"-c", "'" + zrctlProgram_ + "' " + rest});
        const int status = shell->wait();
        return std::to_string(status) + ' ' + shell->err();
    };
    EXPECT_EQ(inShell("elect use none 2> /dev/full"), "1 ");
    EXPECT_THAT(inShell("match > /dev/full"), HasSubstr("3 zrctl: cannot write: "));
    EXPECT_THAT(inShell("--help > /dev/full"), HasSubstr("3 zrctl: cannot write: "));
}

TEST_F(Zrctl, AnnotationsJoinThoseThatAreThereOrReplaceThem) {
    start();
    const auto extension = [](Dictionary pairs) {
        return Value(Dictionary{{"extension", std::move(pairs)}});
    };
    EXPECT_EQ(run({"annotate", "a=text=1", "one", "b=true", "three"}), "0 ");
    EXPECT_EQ(annotations("one"), extension({{"a", "text=1"}, {"b", true}}));
    EXPECT_EQ(run({"annotate", "one", "b=x", "b=y"}), "0 ");
    EXPECT_EQ(annotations("one"), extension({{"a", "text=1"}, {"b", Array{"x", "y"}}}));
    EXPECT_EQ(annotations("three"), extension({{"a", "text=1"}, {"b", true}}));
    EXPECT_EQ(run({"annotate", "--replace", "one", "three", "c="}), "0 ");
    EXPECT_EQ(annotations("one"), extension({{"c", ""}}));
    EXPECT_EQ(annotations("three"), extension({{"c", ""}}));
    EXPECT_THAT(run({"annotate", "one"}), HasSubstr("2 zrctl: there is no KEY=VALUE"));
    EXPECT_THAT(run({"annotate", "k=v"}), HasSubstr("2 zrctl: no plug-in is named"));
    EXPECT_THAT(run({"annotate", "one", "k=\xff"}), HasSubstr("2 zrctl: "));
}

TEST_F(Zrctl, WatchingTellsOfEachChangeUntilItIsInterrupted) {
    start();
    for (const int signal : {SIGINT, SIGTERM}) {
        const auto watch = spawn(zrctlProgram_.c_str(), {"watch"});
        ASSERT_TRUE(waitUntil([&] {
            EXPECT_EQ(run({"elect", "use", "one"}), "0 ");
            return !watch->out().empty();
        }));
        EXPECT_THAT(watch->out(), HasSubstr("Z com.orbel.zorvan.annotation-change\n"));
        watch->signal(signal);
        EXPECT_EQ(watch->wait(), 0) << watch->err();
    }
}

TEST_F(Zrctl, ExclusionsAreEditedWithoutLoss) {
    start();
    EXPECT_EQ(run({"exclude", "list"}), "1 zrctl: nothing is excluded\n");
    EXPECT_EQ(run({"exclude", "add", "VXExtensionIdentifier=two", "VXExtensionVersion=>=1.10"}),
              "0 ");
    EXPECT_EQ(match({}, 1), (std::vector<std::string>{"one 1", "three 1", "two 1"}));
    std::string file;
    for (const auto& entry :
         std::filesystem::directory_iterator(home_.path("config/zorvan/ByHost")))
        file = entry.path().filename();
    const Value odd = Array{Dictionary{{"Offer", Dictionary{{"k", 1}}}}, "no rule", Dictionary()};
    writePlist("config/zorvan/ByHost/" + file, Dictionary{{"other", 1}, {"exclusions", odd}});
    EXPECT_EQ(run({"exclude", "add", "A=b", "C=<d"}), "0 ");
    EXPECT_EQ(run({"exclude", "add", "C=<d", "A=b"}), "0 ");
    const std::string rules = zrctl({"exclude", "list"})->out();
    EXPECT_EQ(rules, "'Offer={k: 1}'\n''\nA=b 'C=<d'\n");
    EXPECT_EQ(run({"exclude", "remove", "A=b"}), "1 zrctl: no such rule is excluded\n");
    for (const std::vector<std::string>& rule :
         std::vector<std::vector<std::string>>{{"C=<d", "A=b"}, {""}, {"Offer={k: 1}"}}) {
        std::vector<std::string> arguments{"exclude", "remove"};
        arguments.insert(arguments.end(), rule.begin(), rule.end());
        EXPECT_EQ(run(arguments), "0 ");
    }
    const std::string path = home_.path("config/zorvan/ByHost/" + file);
    EXPECT_EQ(*platform::readPropertyListFile(path),
              Value(Dictionary{{"other", 1}, {"exclusions", Array{"no rule"}}}));

    for (const Value& list : {Value("text"), Value(Dictionary())}) {
        writePlist("config/zorvan/ByHost/" + file, Dictionary{{"exclusions", list}});
        for (const char* command : {"list", "add"}) {
            std::vector<std::string> arguments{"exclude", command};
            if (command == std::string("add")) arguments.push_back("A=b");
            EXPECT_THAT(run(arguments), HasSubstr("3 zrctl: " + path + ": "));
        }
        EXPECT_EQ(*platform::readPropertyListFile(path), Value(Dictionary{{"exclusions", list}}));
    }
    home_.write("config/zorvan/ByHost/" + file, "damaged");
    EXPECT_THAT(run({"exclude", "add", "A=b"}), HasSubstr("3 zrctl: " + path + ": "));
    EXPECT_THAT(run({"exclude", "remove", "A=b"}), HasSubstr("3 zrctl: " + path + ": "));
}

}  // namespace

}  // namespace test
