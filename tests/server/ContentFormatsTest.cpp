#include <gtest/gtest.h>

#include "server/ByteRange.h"
#include "server/ContentTypes.h"

namespace tamber {
namespace {

using Outcome = ByteRange::Outcome;

void expectPart(const char* header, uint64_t size, uint64_t first, uint64_t length) {
    auto range = ByteRange::parse(header, size);
    EXPECT_EQ(range.outcome, Outcome::Part) << header;
    EXPECT_EQ(range.first, first) << header;
    EXPECT_EQ(range.length, length) << header;
}

TEST(ByteRangeTest, ResolvesEachFormAgainstTheSize) {
    expectPart("bytes=0-0", 10, 0, 1);
    expectPart("bytes=2-5", 10, 2, 4);
    expectPart("bytes=4-", 10, 4, 6);
    expectPart("bytes=-3", 10, 7, 3);
    expectPart("bytes=-30", 10, 0, 10);    // more than there is: all of it
    expectPart("bytes=8-1000", 10, 8, 2);  // an end past the size is cut to it
    expectPart(" bytes=1-2 ", 10, 1, 2);
}

TEST(ByteRangeTest, TellsUnsatisfiableFromMalformedFromIgnored) {
    EXPECT_EQ(ByteRange::parse("bytes=10-", 10).outcome, Outcome::Unsatisfiable);
    EXPECT_EQ(ByteRange::parse("bytes=10-20", 10).outcome, Outcome::Unsatisfiable);
    EXPECT_EQ(ByteRange::parse("bytes=-0", 10).outcome, Outcome::Unsatisfiable);
    EXPECT_EQ(ByteRange::parse("bytes=0-", 0).outcome, Outcome::Unsatisfiable);
    for (const char* bad : {"bytes=", "bytes=5", "bytes=a-b", "bytes=5-2", "bytes=-", "bytes=1-2x",
                            "bytes=99999999999999999999-"})
        EXPECT_EQ(ByteRange::parse(bad, 10).outcome, Outcome::Malformed) << bad;
    for (const char* whole : {"", "items=0-1", "bytes=0-1,3-4"})
        EXPECT_EQ(ByteRange::parse(whole, 10).outcome, Outcome::Whole) << whole;
}

TEST(ContentTypesTest, LabelsByTypeWithTextAsUtf8AndUnknownAsBytes) {
    EXPECT_EQ(ContentTypes::mediaTypeFor("public.png"), "image/png");
    EXPECT_EQ(ContentTypes::mediaTypeFor("public.jpeg"), "image/jpeg");
    EXPECT_EQ(ContentTypes::mediaTypeFor("public.pdf"), "application/pdf");
    EXPECT_EQ(ContentTypes::mediaTypeFor("public.source-code"), "text/plain; charset=utf-8");
    EXPECT_EQ(ContentTypes::mediaTypeFor("public.json"), "application/json");
    EXPECT_EQ(ContentTypes::mediaTypeFor("public.data"), "application/octet-stream");
    EXPECT_EQ(ContentTypes::mediaTypeFor("public.folder"), "application/octet-stream");
    EXPECT_EQ(ContentTypes::mediaTypeFor("com.example.unknown"), "application/octet-stream");
}

TEST(ContentTypesTest, DispositionCannotBreakOutOfItsHeader) {
    EXPECT_EQ(ContentTypes::attachmentDisposition("a b.txt"),
              "attachment; filename*=UTF-8''a%20b.txt");
    EXPECT_EQ(ContentTypes::attachmentDisposition("x\";\r\nSet-Cookie: y"),
              "attachment; filename*=UTF-8''x%22%3B%0D%0ASet-Cookie%3A%20y");
    EXPECT_EQ(ContentTypes::attachmentDisposition("\xC3\xA9t\xC3\xA9.pdf"),
              "attachment; filename*=UTF-8''%C3%A9t%C3%A9.pdf");
}

}  // namespace
}  // namespace tamber
