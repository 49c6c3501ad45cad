// What users choose, and that it lasts.

#include <sys/resource.h>

#include <atomic>
#include <csignal>
#include <filesystem>

#include "platform/plist/PropertyList.h"
#include "platform/system/Files.h"
#include "tests/system/SystemTest.h"

namespace test {

namespace {

using platform::Uuid;
using testing::ElementsAre;

class Annotations : public SystemTest {
  protected:
    Annotations() {
        for (const char* name : {"a", "b", "c"}) writePlugIn(plugInPath("A", name), info(name));
    }

    Uuid uuidOf(const std::string& identifier) {
        const auto found = forms({{"VXExtensionIdentifier", identifier}});
        return *Uuid::parse(*found.at(0).find("uuid")->string());
    }
    std::string annotate(const std::vector<Uuid>& plugIns, const Dictionary& annotations) {
        return errorOf(ask([&](auto& client, auto& reply) {
            client.setPluginAnnotations(plugIns, annotations, reply);
        }));
    }
    std::string bulkAnnotate(const Dictionary& annotations) {
        return errorOf(ask([&](auto& client, auto& reply) {
            client.bulkSetPluginAnnotations(annotations, reply);
        }));
    }
    std::vector<std::string> elected(const std::string& election) {
        return match({{"VXUserElection", election}});
    }
    /// The "data" of the annotation file.
    Dictionary stored() const {
        const auto root = platform::readPropertyListFile(file_, 1 << 20);
        EXPECT_TRUE(root) << (root ? "" : describe(root.error()));
        const Value* data = root && root->dictionary() ? root->dictionary()->find("data") : nullptr;
        EXPECT_TRUE(data);
        return data ? *data->dictionary() : Dictionary();
    }

    const std::string file_ = home_.path("state/com.orbel.zorvan/Annotations");
};

TEST_F(Annotations, ChoicesNarrowMatchesAndOutliveTheDaemon) {
    start();
    const Uuid a = uuidOf("a"), b = uuidOf("b");
    EXPECT_EQ(annotate({a, b}, {{"election", 1}, {"extension", Dictionary{{"k", "v"}}}}), "");
    EXPECT_EQ(annotate({b}, {{"election", 2}}), "");
    EXPECT_EQ(bulkAnnotate({{uuidOf("c").string(), Dictionary{{"only", "c"}}}}), "");
    stop(SIGKILL);
    start();
    EXPECT_THAT(elected("1"), ElementsAre("a 1"));
    EXPECT_THAT(elected("2"), ElementsAre("b 1"));
    EXPECT_THAT(elected("0"), ElementsAre("c 1"));
    EXPECT_EQ(*forms({{"VXExtensionIdentifier", "b"}})[0].find("annotations"),
              Value(Dictionary{{"election", 2}, {"extension", Dictionary{{"k", "v"}}}}));
    EXPECT_EQ(uuidOf("a"), a) << "unchanged bundles keep their identity";
}

TEST_F(Annotations, SurviveBeingKilledAtAnyMoment) {
    constexpr int kKills = 20, kChanges = 10;
    std::filesystem::create_directories(std::filesystem::path(file_).parent_path());
    // Nobody's business but its owner's:
    home_.write("state/com.orbel.zorvan/.tmp-foreign", "mine");
    std::int64_t sent = 0;
    std::atomic<std::int64_t> answered = 0;
    for (int kill = 0; kill < kKills; ++kill) {
        start();
        ASSERT_EQ(annotate({uuidOf("b")}, {{"election", -7}}), "");
        const std::vector<Uuid> a{uuidOf("a")};
        const std::int64_t before = sent;
        for (int i = 0; i < kChanges; ++i) {
            const std::int64_t now = ++sent;
            client_->setPluginAnnotations(a, {{"election", now}}, [&, now](auto& reply) {
                if (errorOf(reply).empty()) answered = now;
            });
        }
        // A moment that differs each time: after so many of the changes.
        const int awaited = kill * kChanges / kKills;
        waitUntil([&] { return awaited == 0 || answered >= before + awaited; });
        stop(SIGKILL);
        client_.reset();

        const Dictionary data = stored();
        EXPECT_EQ(*data.find("b"), Value(Dictionary{{"election", -7}}));
        const Value* entry = data.find("a");
        const std::int64_t kept =
            entry ? *entry->dictionary()->find("election")->signedInteger() : 0;
        EXPECT_GE(kept, answered) << "what was answered is kept";
        EXPECT_LE(kept, sent);
    }
    EXPECT_EQ(*platform::readFile(home_.path("state/com.orbel.zorvan/.tmp-foreign"), 9), "mine");
}

TEST_F(Annotations, AFullDiskDelaysTheFileOnly) {
    start();
    const Uuid a = uuidOf("a"), b = uuidOf("b");
    ASSERT_EQ(annotate({b}, {{"election", 1}}), "");
    const Dictionary before = stored();
    rlimit unlimited{};
    const rlimit full{64 * 1024, RLIM_INFINITY};
    ASSERT_EQ(::prlimit(zrd_->pid(), RLIMIT_FSIZE, &full, &unlimited), 0);
    EXPECT_EQ(annotate({a}, {{"extension", Dictionary{{"k", std::string(100'000, 'x')}}}}), "");
    EXPECT_EQ(zrd_->errLines("unable to save annotations:"), 1u);
    EXPECT_EQ(stored(), before);
    ASSERT_EQ(::prlimit(zrd_->pid(), RLIMIT_FSIZE, &unlimited, nullptr), 0);
    EXPECT_EQ(annotate({b}, {{"election", 2}}), "");
    const Dictionary after = stored();
    EXPECT_TRUE(after.contains("a"));
    EXPECT_EQ(*after.find("b"), Value(Dictionary{{"election", 2}}));
}

}  // namespace

}  // namespace test
