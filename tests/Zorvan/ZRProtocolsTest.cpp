#include "Zorvan/ZRProtocols.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "tests/Zorvan/LogLines.h"

namespace zorvan {

namespace {

using platform::Array;
using platform::ObjectInterface;
using testing::ElementsAre;

class ProtocolsTest : public testing::Test {
  protected:
    ProtocolsTest() {
        for (const char* name : {"P", "Q"})
            runtime_.registerProtocol(runtime_.allocateProtocol(name));
        for (const char* name : {"A", "B"}) runtime_.registerClass(name);
    }
    /// "<code> <text>" of what is wrong with a description.
    std::string describe(const std::string& description) {
        const auto error = ZRDescribeInterface(runtime_, interface_, "do", description);
        return error ? std::to_string(error->code) + ' ' + *error->description : "";
    }

    platform::ObjectRuntime runtime_;
    ObjectInterface interface_{runtime_.protocol("P")};
};

TEST_F(ProtocolsTest, CompoundsIncorporateTheirMembersAndAreMadeOnce) {
    std::optional<ZRError> error;
    const auto compound = ZRCompoundProtocol(runtime_, Array{"P", "Q"}, &error);
    ASSERT_TRUE(compound);
    EXPECT_EQ(compound->name, "__XX_COMPOUND__P__Q");
    EXPECT_THAT(compound->incorporated,
                ElementsAre(runtime_.protocol("P"), runtime_.protocol("Q")));
    EXPECT_EQ(ZRCompoundProtocol(runtime_, Array{"P", "Q"}, &error), compound);
    EXPECT_EQ(ZRCompoundProtocol(runtime_, "P", &error), runtime_.protocol("P"));
    EXPECT_FALSE(ZRCompoundProtocol(runtime_, 7, &error));
    EXPECT_FALSE(error);

    LogLines log(LogLines::Private::Hidden);
    EXPECT_FALSE(ZRCompoundProtocol(runtime_, Array{"P", "None"}, &error));
    const std::string start = "unable to locate protocol \"",
                      end = "\" - check that it is defined and not inadvertently optimized away";
    EXPECT_EQ(error, ZRErrorWithCode(12, start + "None" + end));
    EXPECT_THAT(log.take(), ElementsAre("ops -: " + start + "<private>" + end));
    EXPECT_FALSE(runtime_.protocol("__XX_COMPOUND__P__None"));
}

TEST_F(ProtocolsTest, DescriptionsSetArgumentsUpToTheFirstThatIsWrong) {
    EXPECT_EQ(describe("request:0:{A+B},reply:1:Q"), "");
    EXPECT_THAT(*interface_.classes({"do", 0, false}), ElementsAre("A", "B"));
    EXPECT_EQ(interface_.interface({"do", 1, true})->protocol(), runtime_.protocol("Q"));
    EXPECT_FALSE(interface_.classes({"do", 0, true}));
    EXPECT_EQ(describe("request: +010th:{B}"), "");
    EXPECT_THAT(*interface_.classes({"do", 10, false}), ElementsAre("B"));

    EXPECT_EQ(describe("request:3:{A},request:0"), "6 request:3:{A},request:0");
    EXPECT_TRUE(interface_.classes({"do", 3, false})) << "what came before stays";
    EXPECT_EQ(describe("answer:0:P"), "6 answer");
    EXPECT_EQ(describe("reply:0:{A"), "6 {A");
    EXPECT_EQ(describe("reply:0:{A+C}"), "6 C");
    EXPECT_EQ(describe("reply:0:{}"), "6 ");
    EXPECT_EQ(describe("reply:0:None"), "6 None");
    EXPECT_EQ(describe(""), "6 ");
}

}  // namespace

}  // namespace zorvan
