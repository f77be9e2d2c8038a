#include "interface_listing.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "text.h"

namespace {

using namespace TERN::HA::Daemon;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::Pair;
using Outcome = InterfaceListing::Outcome;

constexpr char TITLE[] = "Iface MTU RX-OK RX-ERR TX-OK Flg\n";

// A stream that reads a text.
class Stream {
 public:
    explicit Stream(const std::string& text)
        : _text(text), _stream(fmemopen(_text.data(), _text.size(), "r")) {}
    ~Stream() { std::fclose(_stream); }

    Stream(const Stream&) = delete;
    Stream& operator=(const Stream&) = delete;

    std::FILE* get() const { return _stream; }

 private:
    std::string _text;
    std::FILE* _stream;
};

InterfaceListing read(const std::string& text) {
    const Stream stream(text);
    InterfaceListing listing = readInterfaceListing(stream.get(), "eth1");
    if (listing.outcome == Outcome::READ) {
        EXPECT_EQ(std::fgetc(stream.get()), EOF) << "not read to the end";
    }
    return listing;
}

TEST(InterfaceListingTest, ReturnsCountersByColumnTitle) {
    const InterfaceListing listing =
        read(TITLE + std::string("lo 65536 1 2 3 LRU\neth1 1500 10 0x20 -30 BMRU\neth10 1500 7 7 7 BMRU\n"));
    EXPECT_EQ(listing.outcome, Outcome::READ);
    EXPECT_THAT(listing.counters, ElementsAre(Pair("RX-ERR", 32), Pair("RX-OK", 10), Pair("TX-OK", -30)));
}

TEST(InterfaceListingTest, UnlistedInterfaceYieldsColumnIndexes) {
    EXPECT_THAT(read(TITLE).counters, ElementsAre(Pair("RX-ERR", 3), Pair("RX-OK", 2), Pair("TX-OK", 4)));
}

TEST(InterfaceListingTest, UnknownTitleYieldsNoCounters) {
    const InterfaceListing listing = read("Kernel Interface table\neth1 1500 10 20 30 BMRU\n");
    EXPECT_EQ(listing.outcome, Outcome::READ);
    EXPECT_THAT(listing.counters, IsEmpty());
}

TEST(InterfaceListingTest, MissingTitleIsAFailure) {
    EXPECT_EQ(read("").outcome, Outcome::NO_TITLE);
}

TEST(InterfaceListingTest, TooShortLineIsAFailure) {
    EXPECT_EQ(read(TITLE + std::string("eth1 1500 10 20 30\n")).outcome, Outcome::LINE_TOO_SHORT);
}

TEST(InterfaceListingTest, TitleWithoutCountersYieldsNone) {
    const InterfaceListing listing = read("Iface MTU Flg\neth1 1500\n");
    EXPECT_EQ(listing.outcome, Outcome::READ);
    EXPECT_THAT(listing.counters, IsEmpty());
}

TEST(InterfaceListingTest, TitleIsRecognisedByItsFirstCharacters) {
    EXPECT_THAT(read(std::string(" ") + TITLE).counters, IsEmpty());
}

TEST(InterfaceListingTest, OutOfRangeCounterIsNamed) {
    const InterfaceListing listing = read(TITLE + std::string("eth1 1500 10 99999999999999999999 30 BMRU\n"));
    EXPECT_EQ(listing.outcome, Outcome::OUT_OF_RANGE);
    EXPECT_EQ(listing.token, "99999999999999999999");
}

TEST(TextTest, ReadsLongLinesInChunks) {
    const Stream stream("first\n" + std::string(600, 'x') + "\nlast");
    Line line = {};
    EXPECT_EQ(readLine(stream.get(), line), "first\n");
    EXPECT_EQ(readLine(stream.get(), line), std::string(511, 'x'));
    EXPECT_EQ(readLine(stream.get(), line), std::string(89, 'x') + "\n");
    EXPECT_EQ(readLine(stream.get(), line), "last");
    EXPECT_EQ(readLine(stream.get(), line), "");
}

TEST(TextTest, SplitsAtAnyWhitespace) {
    EXPECT_THAT(split(" a\tbc \v\f\r d\n"), ElementsAre("a", "bc", "d"));
    EXPECT_THAT(split(" \n"), IsEmpty());
}

}  // namespace
