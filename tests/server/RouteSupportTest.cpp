#include <gtest/gtest.h>

#include <set>

#include "server/RouteSupport.h"
#include "support/RandomToken.h"

namespace tamber {
namespace {

TEST(RouteSupportTest, ReadsIsoDatesWithFractionsAndOffsets) {
    EXPECT_EQ(RouteSupport::parseIso8601("1970-01-01T00:00:00Z"), 0.0);
    EXPECT_EQ(RouteSupport::parseIso8601("2001-09-09T01:46:40.000Z"), 1.0e9);
    EXPECT_EQ(RouteSupport::parseIso8601("2001-09-09T01:46:40.5Z"), 1.0e9 + 0.5);
    // 03:46:40 at +02:00 is 01:46:40 UTC.
    EXPECT_EQ(RouteSupport::parseIso8601("2001-09-09T03:46:40+02:00"), 1.0e9);
    EXPECT_EQ(RouteSupport::parseIso8601("2001-09-08T23:46:40-02:00"), 1.0e9);
    for (const char* bad :
         {"", "now", "2001-09-09", "2001-09-09T01:46:40", "2001-13-09T01:46:40Z",
          "2001-09-09T24:00:00Z", "2001-09-09T01:46:40.Z", "2001-09-09T01:46:40Zx",
          "2001-09-09 01:46:40Z", "20a1-09-09T01:46:40Z"}) {
        EXPECT_FALSE(RouteSupport::parseIso8601(bad).has_value()) << bad;
    }
}

TEST(RouteSupportTest, ContainerWordsAndBase64FromAQuery) {
    EXPECT_EQ(RouteSupport::identifierFrom("root"), HostPorterRootContainerItemIdentifier);
    EXPECT_EQ(RouteSupport::identifierFrom("working-set"),
              HostPorterWorkingSetContainerItemIdentifier);
    EXPECT_EQ(RouteSupport::identifierFrom("fid=12"), "fid=12");
    // An unencoded "+" arrives as a space; it still decodes to the same bytes.
    auto plus = RouteSupport::base64Parameter("+/8=");
    auto space = RouteSupport::base64Parameter(" /8=");
    ASSERT_TRUE(plus && space);
    EXPECT_EQ(*plus, *space);
    EXPECT_FALSE(RouteSupport::base64Parameter("%%").has_value());
}

TEST(RandomTokenTest, TokensAreLongFreshAndComparedWhole) {
    std::set<std::string> seen;
    for (int i = 0; i < 50; ++i) {
        std::string token = RandomToken::hex(32);
        EXPECT_EQ(token.size(), 64u);
        EXPECT_EQ(token.find_first_not_of("0123456789abcdef"), std::string::npos);
        EXPECT_TRUE(seen.insert(token).second);
    }
    std::string token = *seen.begin();
    EXPECT_TRUE(RandomToken::equal(token, std::string(token)));
    EXPECT_FALSE(RandomToken::equal(token, token.substr(0, 63)));
    EXPECT_FALSE(RandomToken::equal(token.substr(0, 63), token));
    EXPECT_FALSE(RandomToken::equal(token, token + "0"));
    std::string last = token;
    last.back() = last.back() == 'a' ? 'b' : 'a';
    EXPECT_FALSE(RandomToken::equal(token, last));
    EXPECT_FALSE(RandomToken::equal("", token));
    EXPECT_TRUE(RandomToken::equal("", ""));
}

}  // namespace
}  // namespace tamber
