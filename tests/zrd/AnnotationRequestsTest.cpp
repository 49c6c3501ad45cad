#include <algorithm>

#include "tests/zrd/TransactionTest.h"

namespace zorvan {

namespace {

using platform::Uuid;
using testing::Contains;
using testing::HasSubstr;

class AnnotationRequestsTest : public TransactionTest {
  protected:
    void SetUp() override {
        TransactionTest::SetUp();
        workspace_->installed = {makeProxy("com.a"), makeProxy("com.b")};
    }
    Uuid uuid(int index) const { return workspace_->installed[index]->plugInUuid; }
    Dictionary annotate(Value annotations, Value uuids) {
        return ask({{"request", "annotate"}, {"annotations", annotations}, {"uuids", uuids}});
    }
    Dictionary bulkAnnotate(Value annotations) {
        return ask({{"request", "bulk-annotate"}, {"annotations", annotations}});
    }
    /// The annotations of both plug-ins.
    Array stored() {
        Array annotations;
        for (int i : {0, 1}) {
            auto found = server_->annotationForPlugIn(*server_->findPlugIn(uuid(i)));
            annotations.append(found ? Value(*found) : Value("none"));
        }
        return annotations;
    }
    std::size_t posts() { return std::exchange(notifications_->posted, {}).size(); }
};

/// Containers inside one another, the value itself counted.
Value nested(int levels) {
    return levels == 1 ? Value(Dictionary()) : Value(Dictionary{{"k", nested(levels - 1)}});
}

TEST_F(AnnotationRequestsTest, AChangeMergesIntoEveryPlugInNamed) {
    const Dictionary extension{{"note", "x"}};
    LogLines log;
    EXPECT_EQ(annotate(Dictionary{{"election", 1}, {"other", 2}}, Array{uuid(0), uuid(1)}),
              Dictionary());
    const auto lines = log.take();
    const std::string client = "client " + std::to_string(getpid()) + " plug-in ";
    EXPECT_THAT(lines, Contains("ops D: " + client + "com.b(" + uuid(1).string() +
                                ") annotation change: {election: 1}"));
    EXPECT_THAT(lines,
                Contains("ops I: " + client + "com.a(" + uuid(0).string() + ") election := 1"));
    EXPECT_EQ(posts(), 1u);
    EXPECT_EQ(annotate(Dictionary{{"extension", extension}}, Array{uuid(1), uuid(1)}),
              Dictionary());
    EXPECT_EQ(posts(), 1u);
    const auto twice = log.take();
    EXPECT_THAT(twice, Contains(HasSubstr("annotation change")).Times(2)) << "as it is named";
    EXPECT_THAT(twice, Not(Contains(HasSubstr("election :="))));
    EXPECT_EQ(stored(), (Array{Dictionary{{"election", 1}},
                               Dictionary{{"election", 1}, {"extension", extension}}}));
}

TEST_F(AnnotationRequestsTest, BadChangesChangeNothing) {
    const Dictionary noDictionary = error(4, "invalid request format (bad annotations dictionary)");
    const Dictionary noElection = error(4, "invalid request format (annotation election)");
    const Dictionary noExtension = error(4, "invalid request format (annotation extension)");
    const Array both{uuid(0), uuid(1)};
    struct Case {
        Value annotations;
        Dictionary reply;
    };
    const Case cases[] = {
        {Array{}, noDictionary},
        {Dictionary{{"election", "1"}, {"extension", 1}}, noElection},
        {Dictionary{{"election", 1}, {"extension", Array{}}}, noExtension},
        // What would spoil the file for everybody:
        {Dictionary{{"extension", Dictionary{{"k", "\x01"}}}}, noDictionary},
        {Dictionary{{"extension", Dictionary{{"k", uuid(0)}}}}, noDictionary},
        {Dictionary{{"extension", nested(64)}}, noDictionary},
        // Nothing to change: the list is not looked at.
        {Dictionary{{"other", 1}}, {}},
    };
    for (const auto& [annotations, reply] : cases)
        EXPECT_EQ(annotate(annotations, both), reply) << describe(annotations);
    EXPECT_EQ(ask({{"request", "annotate"}, {"annotations", Dictionary()}}), Dictionary());
    EXPECT_EQ(ask({{"request", "annotate"}}), noDictionary);
    EXPECT_EQ(stored(), (Array{"none", "none"}));
    EXPECT_EQ(posts(), 0u);
    EXPECT_EQ(annotate(Dictionary{{"extension", nested(63)}, {"election", true}}, both),
              Dictionary());
    EXPECT_EQ(posts(), 1u);
}

TEST_F(AnnotationRequestsTest, NoHostCanFillTheStoreForOthers) {
    const auto withObjects = [](std::size_t count) {
        return Dictionary{{"k", Array(std::vector<Value>(count, Value(1)))}};
    };
    // What an earlier daemon has stored leaves room for less than what may be read back.
    server_->setAnnotation(Dictionary{{"extension", withObjects(470'000)}},
                           *server_->findPlugIn(uuid(0)));
    const Dictionary extension = withObjects(60'000), large{{"extension", extension}};
    LogLines log(LogLines::Private::Hidden);
    const std::string told = "ops I: client " + std::to_string(getpid()) + " plug-in <private>(" +
                             uuid(1).string() + ") annotation refused: ";
    const Dictionary full = error(11, "no room for more annotations");
    EXPECT_EQ(annotate(large, Array{uuid(1)}), full);
    EXPECT_THAT(log.take(), Contains(told + "the annotations are too large"));
    EXPECT_EQ(bulkAnnotate(Dictionary{{uuid(1).string(), extension}}), full);
    EXPECT_EQ(annotate(Dictionary{{"election", 2}}, Array{uuid(1)}), Dictionary());
    EXPECT_THAT(log.take(), Not(Contains(HasSubstr("unable to save"))));
    EXPECT_EQ(annotate(large, Array{uuid(0)}), Dictionary()) << "it takes its own place";
    EXPECT_EQ(annotate(large, Array{uuid(1)}), Dictionary());

    // The two are less than a quarter; with any more of them it would be over.
    const Dictionary more = withObjects(80'000);
    const Dictionary refused = error(11, "too many annotations");
    EXPECT_EQ(annotate(Dictionary{{"extension", more}}, Array{uuid(1)}), refused);
    EXPECT_THAT(log.take(), Contains(told + "it and those it belongs with have stored too much"));
    EXPECT_EQ(bulkAnnotate(Dictionary{{uuid(0).string(), more}}), refused);
    const ZRDPlugInRef plugIn = server_->findPlugIn(uuid(1));
    EXPECT_TRUE(server_->hasShareForAnnotation({{"extension", more}}, *plugIn, {1, 1, 0}));
    server_->setAnnotation(large, *plugIn, platform::Origin{1, 1, 0});
    EXPECT_EQ(annotate(Dictionary{{"extension", more}}, Array{uuid(0)}), Dictionary())
        << "what somebody else has replaced is theirs";
}

TEST_F(AnnotationRequestsTest, TheListIsWalkedUpToTheFirstFailure) {
    const Dictionary unknown = error(4, "no such plugin (uuid not found)");
    const Dictionary noUuid = error(4, "invalid request (bad uuid array)");
    const Dictionary noList = error(4, "invalid request format (uuid)");
    int election = 0;
    auto elect = [&](Value uuids) { return annotate(Dictionary{{"election", ++election}}, uuids); };
    EXPECT_EQ(elect(Array{uuid(0), Uuid::random(), uuid(1)}), unknown);
    EXPECT_EQ(stored(), (Array{Dictionary{{"election", 1}}, "none"}));
    EXPECT_EQ(elect(Array{uuid(0), uuid(1).string()}), noUuid);
    EXPECT_EQ(elect("x"), noList);
    EXPECT_EQ(ask({{"request", "annotate"}, {"annotations", Dictionary{{"election", 9}}}}), noList);
    EXPECT_EQ(stored(), (Array{Dictionary{{"election", 2}}, "none"}));
    EXPECT_EQ(posts(), 0u);
}

TEST_F(AnnotationRequestsTest, BulkChangesGiveEachPlugInItsOwnExtension) {
    annotate(Dictionary{{"election", -1}}, Array{uuid(0)});
    posts();
    const Dictionary first{{"a", 1}}, second{{"b", Array{"c"}}};
    std::string lower = uuid(1).string();
    std::ranges::transform(lower, lower.begin(), [](unsigned char c) { return std::tolower(c); });
    EXPECT_EQ(bulkAnnotate(Dictionary{{uuid(0).string(), first}, {lower, second}}), Dictionary());
    EXPECT_EQ(stored(), (Array{Dictionary{{"election", -1}, {"extension", first}},
                               Dictionary{{"extension", second}}}));
    EXPECT_EQ(posts(), 1u);
    EXPECT_EQ(bulkAnnotate(Dictionary()), Dictionary());
    EXPECT_EQ(posts(), 1u);

    // Two spellings of one UUID, of which the later one in the order of keys counts.
    EXPECT_EQ(bulkAnnotate(Dictionary{{uuid(1).string(), first}, {lower, second}}), Dictionary());
    EXPECT_EQ(*stored()[1].dictionary()->find("extension"), Value(second));
    EXPECT_EQ(posts(), 1u);

    const std::string known = uuid(0).string();
    EXPECT_EQ(bulkAnnotate("x"), error(4, "invalid request format (bad annotations dictionary)"));
    EXPECT_EQ(bulkAnnotate(Dictionary{{known, 1}}),
              error(18, "annotations values must be dictionaries"));
    EXPECT_EQ(bulkAnnotate(Dictionary{{"no uuid", Dictionary()}}),
              error(18, "invalid plug-in UUID value"));
    // Entries are visited in the order of their keys.
    EXPECT_EQ(bulkAnnotate(Dictionary{{known, Dictionary()}, {"g", 1}}),
              error(18, "annotations values must be dictionaries"));
    EXPECT_EQ(bulkAnnotate(Dictionary{{Uuid::random().string(), Dictionary()}}),
              error(2, "no plug-in with the requested uuid"));
    EXPECT_EQ(*stored()[0].dictionary()->find("extension"), Value(Dictionary()));
    EXPECT_EQ(posts(), 0u);
}

TEST_F(AnnotationRequestsTest, OthersAreServedWhileTheFileIsReplaced) {
    const auto other = std::make_shared<FakeConnection>();
    connect(other);
    const Dictionary bulk{{uuid(0).string(), Dictionary()}, {uuid(1).string(), Dictionary()}};
    const Dictionary changing[] = {
        {{"request", "annotate"},
         {"version", 3},
         {"annotations", Dictionary{{"election", 1}}},
         {"uuids", Array{uuid(0), uuid(1)}}},
        {{"request", "bulk-annotate"}, {"version", 3}, {"annotations", bulk}}};
    for (const Dictionary& request : changing) {
        std::promise<void> go;
        bool wasAnswered = true;
        server_->submitWork([blocked = go.get_future().share()] { blocked.wait(); });
        deliver(platform::Message(request));
        other->deliver(platform::Message({{"request", "match"}, {"version", 3}}));
        server_->submitWork([&] { wasAnswered = connection_->isAnswered; });
        go.set_value();
        EXPECT_TRUE(answer(*other).contains("matches"));
        EXPECT_FALSE(wasAnswered) << "its first change lets the match in";
        EXPECT_EQ(answer(*connection_), Dictionary());
        EXPECT_EQ(posts(), 1u);
    }
    const Dictionary annotation{{"election", 1}, {"extension", Dictionary()}};
    EXPECT_EQ(stored(), (Array{annotation, annotation}));
}

}  // namespace

}  // namespace zorvan
