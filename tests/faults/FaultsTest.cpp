// What the daemon keeps, whatever befalls it while it is being stored: it is killed at each system
// call of the work, or that call fails. scripts/faults.sh runs this; it takes some minutes.

#include <chrono>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iostream>

#include "platform/log/Log.h"
#include "tests/faults/Tracer.h"
#include "tests/system/SystemTest.h"

namespace test {

namespace {

namespace fs = std::filesystem;
using platform::Uuid;
using testing::IsSubsetOf;
using testing::IsSupersetOf;

class Faults : public SystemTest {
  protected:
    using Texts = std::vector<std::string>;
    /// Asks for something that is to be kept; answers why not, or nothing when that was promised.
    using Work = std::function<std::string()>;

    void SetUp() override {
        // This process expects to lose its connections; the daemon may say what it likes.
        ::setenv("ZR_LOG", "off", 1);
        platform::Log::defaultHandle();
        ::unsetenv("ZR_LOG");
        writePlist(kApps + std::string("A.app/Info.plist"), Dictionary{{"QFBundleName", "A"}});
        writePlist("elsewhere/B.app/Info.plist", Dictionary{{"QFBundleName", "B"}});
        for (const char* name : {"a", "b", "c"}) writePlugIn(plugInPath("A", name), info(name));
        for (const char* name : {"x", "y"})
            writePlugIn("elsewhere/B.app/PlugIns/" + std::string(name) + ".appex", info(name));
        start();
        for (const char* name : {"a", "b", "c"}) uuids_[name] = uuidOf(name);
        ASSERT_EQ(elect("b", 7), "");
        waitUntilIdle(zrd_->pid());
        stop(SIGTERM);
        exchange(home_.path(), home_.path("kept"));
    }

    /// Does the work once for every fault that it can meet, each time over the same state, and
    /// `check`s after the daemon's next start what is there. After a failure the work is repeated,
    /// so that it is promised then, and `mended` goes on.
    void meet(
        const Work& work, const std::function<void(bool promised)>& check,
        const std::function<void()>& mended = [] {}) {
        restart();
        Tracer tracer(zrd_->pid(), Tracer::Others, notes_, nullptr);
        EXPECT_EQ(work(), "");
        tracer.stop();
        stop(SIGKILL);
        forEachOf(tracer.faults(), [&](const Fault& fault) { meet(fault, work, check, mended); });
    }

    /// Calls `meetIt` for every fault, or for every n-th of them when the environment says so.
    void forEachOf(const std::vector<Fault>& faults,
                   const std::function<void(const Fault&)>& meetIt) {
        const char* every = std::getenv("ZR_FAULTS_EVERY");
        const std::size_t step = every ? std::strtoul(every, nullptr, 10) : 1;
        std::size_t met = 0;
        for (std::size_t i = faults.size() % step; i < faults.size() && !HasFailure(); i += step) {
            SCOPED_TRACE(faults[i].text());
            meetIt(faults[i]);
            ++met;
        }
        std::cout << "met " << met << " of " << faults.size() << " faults, slowest start "
                  << slowest_.count() << " ms\n";
    }

    /// What daemons and users store, as it is in `from`, becomes what is in `to`.
    static void exchange(const fs::path& from, const fs::path& to) {
        clear(to);
        for (const char* name : {"state", "config", "run"})
            if (fs::exists(from / name)) fs::copy(from / name, to / name, kWhole);
        for (const auto& entry : fs::directory_iterator(from / kData))
            if (entry.path().filename() != "Applications")
                fs::copy(entry, to / kData / entry.path().filename(), kWhole);
    }
    static void clear(const fs::path& home) {
        for (const char* name : {"state", "config", "run"}) fs::remove_all(home / name);
        fs::create_directories(home / kData);
        for (const auto& entry : fs::directory_iterator(home / kData))
            if (entry.path().filename() != "Applications") fs::remove_all(entry);
    }
    /// Starts the daemon after an end that it did not choose.
    void startAgain() {
        client_.reset();
        const auto begin = std::chrono::steady_clock::now();
        start();
        EXPECT_THAT(match(), IsSupersetOf({"b 1", "c 1"}));
        const auto took = std::chrono::duration_cast<std::chrono::milliseconds>(
            std::chrono::steady_clock::now() - begin);
        slowest_ = std::max(slowest_, took);
        EXPECT_LT(took.count(), 1000);
        EXPECT_EQ(zrd_->errLines(" error "), 0u) << zrd_->err();
    }

    Uuid uuidOf(const std::string& identifier) {
        const auto found = forms({{"VXExtensionIdentifier", identifier}});
        return found.empty() ? Uuid() : *Uuid::parse(*found[0].find("uuid")->string());
    }
    std::string elect(const std::string& plugIn, int election) {
        return errorOf(ask([&](auto& client, auto& reply) {
            client.setPluginAnnotations({uuids_.at(plugIn)}, {{"election", election}}, reply);
        }));
    }
    Texts elected(const std::string& election) { return match({{"VXUserElection", election}}); }

    const std::string notes_ = home_.path("notes");

  private:
    static constexpr auto kWhole = fs::copy_options::recursive | fs::copy_options::copy_symlinks;
    static constexpr const char* kData = "data/zorvan";

    void restart() {
        exchange(home_.path("kept"), home_.path());
        start();
        match();
        waitUntilIdle(zrd_->pid());
    }

    void meet(const Fault& fault, const Work& work, const std::function<void(bool)>& check,
              const std::function<void()>& mended) {
        restart();
        Tracer tracer(zrd_->pid(), Tracer::Others, notes_, &fault);
        bool promised = work().empty();
        if (!fault.kills()) {
            tracer.stop();
            promised = promised || work().empty();
            EXPECT_TRUE(promised) << zrd_->err();
            mended();
        }
        zrd_->signal(SIGKILL);
        EXPECT_EQ(zrd_->wait(), -SIGKILL) << zrd_->err();
        startAgain();
        for (const char* name : {"b", "c"}) EXPECT_EQ(uuidOf(name), uuids_.at(name));
        EXPECT_THAT(elected("7"), testing::ElementsAre("b 1"));
        check(promised);
        stop(SIGKILL);
    }

    std::map<std::string, Uuid> uuids_;
    std::chrono::milliseconds slowest_{0};
};

TEST_F(Faults, AnElectionIsKept) {
    meet([&] { return elect("a", 5); },
         [&](bool promised) {
             EXPECT_THAT(elected("5"), IsSubsetOf({"a 1", "c 1"}));
             if (promised) {
                 EXPECT_THAT(elected("5"), testing::Contains("a 1"));
             }
         },
         [&] {
             // A save that failed is told of, and made up for by the next one.
             EXPECT_THAT(elected("5"), testing::Contains("a 1"));
             EXPECT_EQ(elect("c", 5), "");
         });
}

TEST_F(Faults, ARegistrationIsKept) {
    meet([&] { return add({home_.path("elsewhere/B.app")}); },
         [&](bool promised) {
             const Texts found = match();
             EXPECT_THAT(found, IsSubsetOf({"a 1", "b 1", "c 1", "x 1", "y 1"}));
             EXPECT_THAT(found, testing::AnyOf(testing::SizeIs(3), testing::SizeIs(5)));
             if (promised) {
                 EXPECT_THAT(found, IsSupersetOf({"x 1", "y 1"}));
             }
         });
}

TEST_F(Faults, ARemovalIsKept) {
    const std::string path = home_.path(plugInPath("A", "a"));
    meet(
        [&] {
            auto removing = zrctl({"remove", path});
            if (removing->wait() == 0) return std::string();
            add({path});  // so that it can be removed the next time
            return removing->err();
        },
        [&](bool promised) {
            if (promised) {
                EXPECT_THAT(match(), testing::Not(testing::Contains("a 1")));
            }
        });
}

TEST_F(Faults, AHoldIsAnnounced) {
    const std::string file =
        home_.path("run/zorvan/notify/") + zorvan::kAnnotationChangeNotification;
    const auto count = [&] {
        std::ifstream stream(file);
        int posts = 0;
        EXPECT_TRUE(stream >> posts) << file;
        return posts;
    };
    int before = 0;
    meet(
        [&] {
            before = count();
            return errorOf(ask([&](auto& client, auto& reply) {
                client.holdPlugins({home_.path(plugInPath("A", "a"))}, 2, reply);
            }));
        },
        // Holds end with the daemon, and the next one tells so, whatever the last one still told.
        [&](bool) { EXPECT_TRUE(waitUntil([&] { return count() > before; })); },
        [&] {
            // Somebody else writes it.
            EXPECT_TRUE(waitUntil([&] {
                return count() > before || zrd_->errLines("cannot post notification") > 0;
            }));
        });
}

TEST_F(Faults, AnExclusionIsKept) {
    const std::vector<std::string> excluding{zrctlProgram_, "exclude", "add", "V==9"};
    const auto rules = [&] {
        auto list = zrctl({"exclude", "list"});
        EXPECT_EQ(list->wait(), 0) << list->err();
        const std::string text = list->out();
        return std::ranges::count(text, '\n');
    };
    EXPECT_EQ(zrctl({"exclude", "add", "V==1"})->wait(), 0);
    fs::copy(home_.path("config"), home_.path("kept/config"), fs::copy_options::recursive);
    Tracer tracer(excluding, notes_, nullptr);
    EXPECT_EQ(tracer.wait(), 0);
    start();
    forEachOf(tracer.faults("ByHost"), [&](const Fault& fault) {
        fs::remove_all(home_.path("config"));
        fs::copy(home_.path("kept/config"), home_.path("config"), fs::copy_options::recursive);
        const bool promised = Tracer(excluding, notes_, &fault).wait() == 0;
        EXPECT_THAT(rules(), testing::AnyOf(promised ? 2 : 1, 2));
        EXPECT_EQ(zrctl({"exclude", "add", "V==9"})->wait(), 0);
        EXPECT_EQ(rules(), 2);
        EXPECT_THAT(match(), IsSupersetOf({"b 1", "c 1"}));
    });
}

TEST_F(Faults, WhatAFirstStartHasShownStaysAsItIs) {
    std::map<std::string, Uuid> shown;
    const auto startUnder = [&](const Fault* fault) {
        clear(home_.path());
        home_.makeDirectory("run");
        shown.clear();
        zrd_ = spawn("/bin/sh", {"-c", "kill -STOP $$; exec " ZRD_PROGRAM});
        Tracer tracer(zrd_->pid(), Tracer::All, notes_, fault);
        zrd_->signal(SIGCONT);
        waitUntil([&] { return !zrd_->isRunning() || RawClient(socket_).isConnected(); });
        client_ = ZRDaemonClient::initWithServiceName(nullptr);
        const auto reply =
            ask([&](auto& client, auto& callback) { client.matchPlugIns({}, 0, callback); });
        const auto* message = std::get_if<platform::Message>(&reply);
        const Value* packed = message ? message->find(zorvan::message::kMatches) : nullptr;
        const auto matches = packed ? client_->convertFromLum(*packed) : std::nullopt;
        if (matches) {
            for (const Value& form : *matches->array())
                shown[form.dictionary()->find("identifier")->string()->string()] =
                    *Uuid::parse(*form.dictionary()->find("uuid")->string());
        }
        zrd_->signal(SIGKILL);
        zrd_->wait();
        tracer.stop();
        return tracer.faults("Tandry.db");
    };
    std::vector<Fault> kills = startUnder(nullptr);
    std::erase_if(kills, [](const Fault& fault) { return !fault.kills(); });
    forEachOf(kills, [&](const Fault& fault) {
        startUnder(&fault);
        startAgain();
        for (const auto& [name, uuid] : shown) EXPECT_EQ(uuidOf(name), uuid) << name;
        stop(SIGKILL);
    });
}

}  // namespace

}  // namespace test
