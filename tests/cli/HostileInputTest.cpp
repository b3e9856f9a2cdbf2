#include <gtest/gtest.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <future>
#include <limits>
#include <memory>
#include <nlohmann/json.hpp>
#include <sstream>
#include <thread>

#include "cli/TextEscape.h"
#include "fs/FSChangeToken.h"
#include "platform/archive/PlistNode.h"
#include "platform/tremors/TremorService.h"
#include "runtime/Base64.h"
#include "runtime/JsonValues.h"
#include "tests/common/CliRunner.h"
#include "tests/common/CommandLineTest.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using nlohmann::json;
using testing::CliRun;

constexpr uint64_t kMax = std::numeric_limits<uint64_t>::max();
constexpr uint64_t kInt64Max = static_cast<uint64_t>(std::numeric_limits<int64_t>::max());
// Far beyond any honest run of a verb here; it only turns a hang into a failure.
constexpr auto kDeadline = std::chrono::seconds(60);

// Extreme and malformed values through every verb that reads them. Each run must end with an
// answer or a clear error: a verb that hangs ends the test program with a failure instead of
// blocking the suite, and a crash ends it by itself.
class HostileInputTest : public testing::CommandLineTest {
protected:
    CliRun tamber(std::vector<std::string> args) {
        if (auto service = TremorService::sharedIfRunning())
            service->sync();
        args.insert(args.begin(), {"--storage", storage});
        std::string shown;
        for (const auto& a : args) shown += " " + a.substr(0, 300);
        auto task = std::make_shared<std::packaged_task<CliRun()>>(
            [args = std::move(args)] { return testing::runTamber(args); });
        std::future<CliRun> result = task->get_future();
        std::thread([task] { (*task)(); }).detach();
        if (result.wait_for(kDeadline) != std::future_status::ready) {
            // The hung run still holds the test's state: nothing can be cleaned up safely.
            std::fprintf(stderr, "FAILED: tamber%s did not finish\n", shown.c_str());
            std::fflush(stderr);
            std::_Exit(1);
        }
        return result.get();
    }
    json tamberJson(std::vector<std::string> args) {
        args.push_back("--json");
        CliRun run = tamber(std::move(args));
        json parsed = json::parse(run.out, nullptr, false);
        EXPECT_FALSE(parsed.is_discarded()) << run.out << run.err;
        parsed["status"] = run.status;
        return parsed;
    }
    // The token inside a base64 anchor or page token that a verb printed.
    static FSChangeToken tokenOf(const std::string& base64) {
        auto bytes = base64Decode(base64);
        EXPECT_TRUE(bytes);
        auto token = bytes ? FSChangeToken::decode(*bytes) : std::nullopt;
        EXPECT_TRUE(token) << base64;
        return token.value_or(FSChangeToken{});
    }
    static std::string encoded(const FSChangeToken& token) { return base64Encode(token.encode()); }
    // A dictionary with the token's keys where `wrongKey` holds a string instead of a number.
    static std::string withWrongType(const FSChangeToken& token, const std::string& wrongKey) {
        PlistNode dictionary = PlistNode::dictionary();
        for (const char* key : {"version", "streamEventID", "offset", "appLibraryVersionToken"}) {
            PlistNode::set(dictionary.get(), key,
                           key == wrongKey ? PlistNode::string("12")
                                           : PlistNode::unsignedInteger(token.streamEventID));
        }
        PlistNode::set(dictionary.get(), "deviceUUID", PlistNode::string(token.deviceUUID));
        return base64Encode(dictionary.toBinary().value());
    }
    // Anchors and page tokens that are not tokens at all: the verb refuses them as input or
    // answers "expired", never anything else.
    static std::vector<std::string> garbageTokens(const FSChangeToken& valid) {
        std::string longText(100000, 'A');
        return {"",
                "not base64!",
                "====",
                "A",
                longText,
                base64Encode(Bytes{'g', 'a', 'r', 'b', 'a', 'g', 'e', '!'}),
                base64Encode(Bytes{'b', 'p', 'l', 'i', 's', 't', '0', '0', 0xff, 0xff}),
                withWrongType(valid, "streamEventID"),
                withWrongType(valid, "offset"),
                base64Encode(PlistNode::array().toBinary().value())};
    }
    static void expectExpiredOrRefused(const json& answer, const std::string& what) {
        ASSERT_TRUE(answer.contains("error")) << what << ": " << answer;
        // Refused as input (a usage error) before the provider sees it, or an anchor that
        // makes the browser start over.
        std::string message = answer["error"].value("message", "");
        if (message.find("is not base64") != std::string::npos) {
            EXPECT_EQ(answer["status"], 2) << what << ": " << answer;
        } else {
            EXPECT_EQ(answer["status"], 1) << what << ": " << answer;
            EXPECT_EQ(answer["error"]["domain"], "HostPorterErrorDomain") << what << ": " << answer;
            EXPECT_EQ(answer["error"]["code"], -1002) << what << ": " << answer;
        }
    }
    static void expectExpired(const json& answer, const std::string& what) {
        EXPECT_EQ(answer["status"], 1) << what << ": " << answer;
        EXPECT_EQ(answer["error"]["domain"], "HostPorterErrorDomain") << what << ": " << answer;
        EXPECT_EQ(answer["error"]["code"], -1002) << what << ": " << answer;
    }
};

TEST_F(HostileInputTest, AnchorsWithAnyEventIDEndAtOnceAndIDsBeyondTheLastExpire) {
    dir.writeFile("Documents/a.txt", "a");
    CliRun first = tamber({"anchor", "root"});
    ASSERT_EQ(first.status, 0) << first.err;
    dir.writeFile("Documents/b.txt", "b");
    CliRun current = tamber({"anchor", "root"});
    ASSERT_EQ(current.status, 0) << current.err;
    const FSChangeToken valid = tokenOf(current.out.substr(0, current.out.find('\n')));
    const uint64_t last = valid.streamEventID;
    ASSERT_GT(last, 1u);

    for (uint64_t id : {uint64_t{0}, uint64_t{1}, last}) {
        FSChangeToken token = valid;
        token.streamEventID = id;
        json answer = tamberJson({"changes", "root", "--anchor", encoded(token)});
        EXPECT_EQ(answer["status"], 0) << id << ": " << answer;
        ASSERT_TRUE(answer.contains("anchor")) << id << ": " << answer;
        // The next anchor never goes past the history, nor behind where it started.
        uint64_t next = tokenOf(answer["anchor"].get<std::string>()).streamEventID;
        EXPECT_GE(next, id);
        EXPECT_LE(next, last + 1);
    }
    for (uint64_t id : {last + 1, kInt64Max, kInt64Max + 1, kMax - 1, kMax}) {
        FSChangeToken token = valid;
        token.streamEventID = id;
        expectExpired(tamberJson({"changes", "root", "--anchor", encoded(token)}),
                      "event " + std::to_string(id));
        // The same for a folder's own change enumeration.
        expectExpired(tamberJson({"changes", storage, "--anchor", encoded(token)}),
                      "folder, event " + std::to_string(id));
    }
    // An offset beyond anything sent, or "negative" when read as signed, skips what the host
    // says it has: a quick answer either way.
    for (uint64_t offset : {kInt64Max + 1, kMax}) {
        FSChangeToken token = valid;
        token.streamEventID = 1;
        token.offset = offset;
        json answer = tamberJson({"changes", "root", "--anchor", encoded(token)});
        if (answer["status"] != 0)
            expectExpired(answer, "offset " + std::to_string(offset));
    }
    FSChangeToken foreign = valid;
    foreign.deviceUUID = "00000000-0000-4000-8000-000000000000";
    expectExpired(tamberJson({"changes", "root", "--anchor", encoded(foreign)}), "foreign UUID");
    for (const std::string& garbage : garbageTokens(valid))
        expectExpiredOrRefused(tamberJson({"changes", "root", "--anchor", garbage}),
                               "anchor \"" + garbage.substr(0, 40) + "\"");
}

TEST_F(HostileInputTest, PageTokensWithAnyEventIDEndAtOnceAndIDsBeyondTheLastExpire) {
    ASSERT_EQ(tamber({"anchor", "root"}).status, 0);  // the journal watches from here
    std::string big = dir.makeDir("Documents/Big");
    for (int i = 0; i < 205; ++i) dir.writeFile("Documents/Big/f" + std::to_string(i));
    json firstPage = tamberJson({"ls", big});
    ASSERT_EQ(firstPage["status"], 0) << firstPage;
    ASSERT_TRUE(firstPage["nextPage"].is_string()) << firstPage;
    const FSChangeToken valid = tokenOf(firstPage["nextPage"].get<std::string>());
    const uint64_t last = valid.streamEventID;
    ASSERT_GT(last, 1u);

    for (uint64_t id : {uint64_t{0}, uint64_t{1}, last}) {
        FSChangeToken token = valid;
        token.streamEventID = id;
        json answer = tamberJson({"ls", big, "--page", encoded(token)});
        // Before the folder came under watch its history is unknown: the listing starts over.
        if (id < last && answer["status"] != 0) {
            expectExpired(answer, "page at event " + std::to_string(id));
            continue;
        }
        EXPECT_EQ(answer["status"], 0) << id << ": " << answer;
        EXPECT_EQ(answer["items"].size(), 5u) << id << ": " << answer;
    }
    for (uint64_t id : {last + 1, kInt64Max, kInt64Max + 1, kMax - 1, kMax}) {
        FSChangeToken token = valid;
        token.streamEventID = id;
        expectExpired(tamberJson({"ls", big, "--page", encoded(token)}),
                      "page at event " + std::to_string(id));
        expectExpired(tamberJson({"ls", "root", "--page", encoded(token)}),
                      "root page at event " + std::to_string(id));
    }
    for (uint64_t offset : {uint64_t{1000000}, kInt64Max + 1, kMax}) {
        FSChangeToken token = valid;
        token.offset = offset;
        json answer = tamberJson({"ls", big, "--page", encoded(token)});
        if (answer["status"] == 0) {
            EXPECT_TRUE(answer["items"].empty()) << offset << ": " << answer;
        } else {
            expectExpired(answer, "offset " + std::to_string(offset));
        }
    }
    FSChangeToken foreign = valid;
    foreign.deviceUUID = "00000000-0000-4000-8000-000000000000";
    expectExpired(tamberJson({"ls", big, "--page", encoded(foreign)}), "foreign UUID");
    for (const std::string& garbage : garbageTokens(valid)) {
        if (garbage.empty())
            continue;  // no --page at all: the first page
        expectExpiredOrRefused(tamberJson({"ls", big, "--page", garbage}),
                               "page \"" + garbage.substr(0, 40) + "\"");
    }
}

TEST_F(HostileInputTest, EventsSinceBeyondTheLastFailsAtOnceAndNonNumbersAreRefused) {
    ASSERT_EQ(tamber({"anchor", "root"}).status, 0);  // the journal watches from here
    dir.writeFile("Documents/a.txt", "a");
    dir.writeFile("Documents/b.txt", "b");
    CliRun anchor = tamber({"anchor", "root"});
    ASSERT_EQ(anchor.status, 0) << anchor.err;
    const uint64_t last = tokenOf(anchor.out.substr(0, anchor.out.find('\n'))).streamEventID;
    ASSERT_GT(last, 1u);

    for (uint64_t id : {uint64_t{0}, uint64_t{1}, last}) {
        for (bool docid : {false, true}) {
            std::vector<std::string> args{"events", "--since", std::to_string(id), "--no-follow"};
            if (docid)
                args.push_back("--docid");
            CliRun run = tamber(args);
            EXPECT_EQ(run.status, 0) << id << ": " << run.err;
        }
    }
    for (uint64_t id : {last + 1, kInt64Max, kInt64Max + 1, kMax - 1, kMax}) {
        for (bool docid : {false, true}) {
            std::vector<std::string> args{"events", "--since", std::to_string(id), "--no-follow"};
            if (docid)
                args.push_back("--docid");
            CliRun run = tamber(args);
            EXPECT_NE(run.status, 0) << id;
            EXPECT_NE(run.err.find("beyond the last event " + std::to_string(last)),
                      std::string::npos)
                << id << ": " << run.err;
            EXPECT_EQ(run.out, "") << id;
            // Without --no-follow too: there is nothing to follow from there.
            args.erase(args.begin() + 3);
            EXPECT_NE(tamber(args).status, 0) << id;
        }
    }
    for (std::string text : {"-1", "abc", "1e9", "", " 1", "1 ", "0x10", "+1",
                             "18446744073709551616", "99999999999999999999999"}) {
        CliRun run = tamber({"events", "--since", text, "--no-follow"});
        EXPECT_NE(run.status, 0) << "\"" << text << "\"";
        EXPECT_NE(run.err.find("--since"), std::string::npos) << "\"" << text << "\": " << run.err;
        EXPECT_EQ(run.out, "") << text;
    }
}

TEST_F(HostileInputTest, MalformedIdentifiersAreRefusedAndNeverNameAnotherItem) {
    std::string file = dir.writeFile("Documents/a.txt", "a");
    CliRun id = tamber({"id", file});
    ASSERT_EQ(id.status, 0) << id.err;
    std::string valid = id.out.substr(0, id.out.find('\n'));
    ASSERT_EQ(valid.rfind("did=", 0), 0u) << valid;

    std::vector<std::string> hostile{"did=",
                                     "did=-1",
                                     "did=18446744073709551616",
                                     "did=18446744073709551615",
                                     "did=4294967297",
                                     "fid=0",
                                     "fid=-1",
                                     "did=abc",
                                     "did=1=2",
                                     "=",
                                     "#",
                                     "#nosuch",
                                     "#" + std::string(5000, 'x'),
                                     "did=" + std::string(5000, '9'),
                                     std::string(5000, 'a'),
                                     valid + "\n",
                                     valid + "\n2",
                                     valid + "x",
                                     " " + valid};
    for (const std::string& identifier : hostile) {
        std::string shown = identifier.substr(0, 60);
        // Verbs that change things too: none may act on the item the identifier's prefix names.
        for (std::vector<std::string> args : std::vector<std::vector<std::string>>{
                 {"item"}, {"path"}, {"ls"}, {"rm"}, {"trash"}, {"rename", "renamed"}}) {
            args.insert(args.begin() + 1, identifier);
            json answer = tamberJson(args);
            // No such item (3), or, for text that is no identifier at all, a path outside
            // the published trees (1).
            EXPECT_TRUE(answer["status"] == 3 || answer["status"] == 1)
                << args[0] << " \"" << shown << "\": " << answer;
            EXPECT_TRUE(answer.contains("error")) << args[0] << " \"" << shown << "\": " << answer;
        }
    }
    EXPECT_TRUE(std::filesystem::exists(file));
    json item = tamberJson({"item", valid});
    EXPECT_EQ(item["status"], 0) << item;
    EXPECT_EQ(item["path"], file);
}

TEST_F(HostileInputTest, NamesThatAreNotUtf8OrHoldControlsAreListedSafely) {
    const std::string badName =
        "bad\xff"
        "name";
    const std::string lineName = "new\nline";
    const std::string longName(255, 'L');
    dir.writeFile("Documents/" + badName, "x");
    dir.writeFile("Documents/" + lineName, "y");
    dir.writeFile("Documents/tab\there\\", "z");
    dir.writeFile("Documents/" + longName, "w");
    std::string bad = storage + "/" + badName;

    json listing = tamberJson({"ls", "root"});
    ASSERT_EQ(listing["status"], 0) << listing;
    std::map<std::string, json> byName;
    for (const auto& item : listing["items"]) byName[item["filename"].get<std::string>()] = item;
    ASSERT_TRUE(
        byName.contains("bad\xef\xbf\xbd"
                        "name"))
        << listing;
    const json& shown = byName
        ["bad\xef\xbf\xbd"
         "name"];
    EXPECT_EQ(shown["filenameBytes"], base64Encode(Bytes(badName.begin(), badName.end())));
    EXPECT_EQ(shown["pathBytes"], base64Encode(Bytes(bad.begin(), bad.end())));
    // Valid names carry no bytes: scripts see them exactly as they are.
    ASSERT_TRUE(byName.contains(lineName)) << listing;
    EXPECT_FALSE(byName[lineName].contains("filenameBytes"));
    EXPECT_FALSE(byName[lineName].contains("pathBytes"));
    EXPECT_TRUE(byName.contains(longName)) << listing;

    // One entry is one line in text, with the name escaped as ls -b does.
    CliRun text = tamber({"ls", "root"});
    ASSERT_EQ(text.status, 0) << text.err;
    EXPECT_EQ(std::count(text.out.begin(), text.out.end(), '\n'), 4) << text.out;
    EXPECT_NE(text.out.find("\tbad\\377name\t"), std::string::npos) << text.out;
    EXPECT_NE(text.out.find("\tnew\\nline\t"), std::string::npos) << text.out;
    EXPECT_NE(text.out.find("\ttab\\there\\\\\t"), std::string::npos) << text.out;

    CliRun record = tamber({"item", bad});
    ASSERT_EQ(record.status, 0) << record.err;
    EXPECT_NE(record.out.find("filename: bad\\377name\n"), std::string::npos) << record.out;
    json recordJson = tamberJson({"item", bad});
    EXPECT_EQ(recordJson["filenameBytes"], shown["filenameBytes"]);

    // The changes verb prints such names the same way.
    CliRun anchor = tamber({"anchor", "root"});
    ASSERT_EQ(anchor.status, 0) << anchor.err;
    std::string a = anchor.out.substr(0, anchor.out.find('\n'));
    std::string later = dir.writeFile("Documents/later\xfe\n", "v");
    CliRun changes = tamber({"changes", "root", "--anchor", a});
    ASSERT_EQ(changes.status, 0) << changes.err;
    EXPECT_NE(changes.out.find("\tlater\\376\\n\n"), std::string::npos) << changes.out;
    json changesJson = tamberJson({"changes", "root", "--anchor", a});
    ASSERT_EQ(changesJson["status"], 0) << changesJson;
    bool sawLater = false;
    for (const auto& item : changesJson["updated"])
        sawLater |= item.value("filenameBytes", "") ==
                    base64Encode(Bytes{'l', 'a', 't', 'e', 'r', 0xfe, '\n'});
    EXPECT_TRUE(sawLater) << changesJson;

    // The journal prints them without failing too, one line per event.
    CliRun events = tamber({"events", "--no-follow", "--json"});
    EXPECT_EQ(events.status, 0) << events.err;
    bool sawBadPath = false;
    std::istringstream lines(events.out);
    for (std::string line; std::getline(lines, line);) {
        json event = json::parse(line, nullptr, false);
        ASSERT_FALSE(event.is_discarded()) << line;
        sawBadPath |=
            event.value("pathBytes", "") == base64Encode(Bytes(later.begin(), later.end()));
    }
    EXPECT_TRUE(sawBadPath) << events.out;
}

TEST_F(HostileInputTest, ItemsWithBadNamesAreRenamedMovedTrashedAndDeletedLikeAnyOther) {
    const std::string badName =
        "bad\xff"
        "name";
    std::string folder = dir.makeDir("Documents/Folder");
    namespace fs = std::filesystem;
    auto idOf = [&](const std::string& path) {
        CliRun run = tamber({"id", path});
        EXPECT_EQ(run.status, 0) << path << ": " << run.err;
        return run.out.substr(0, run.out.find('\n'));
    };

    // By identifier.
    std::string original = dir.writeFile("Documents/" + badName, "1");
    std::string id = idOf(original);
    // A name longer than the file system takes is refused, and nothing changes.
    json tooLong = tamberJson({"rename", id, std::string(256, 'N')});
    EXPECT_EQ(tooLong["status"], 1) << tooLong;
    EXPECT_TRUE(tooLong.contains("error")) << tooLong;
    EXPECT_TRUE(fs::exists(original));
    json renamed = tamberJson({"rename", id, "other\xfe"});
    ASSERT_EQ(renamed["status"], 0) << renamed;
    EXPECT_TRUE(fs::exists(storage + "/other\xfe"));
    EXPECT_EQ(renamed["filenameBytes"], base64Encode(Bytes{'o', 't', 'h', 'e', 'r', 0xfe}));
    json moved = tamberJson({"mv", id, folder});
    ASSERT_EQ(moved["status"], 0) << moved;
    EXPECT_TRUE(fs::exists(folder + "/other\xfe"));
    json trashed = tamberJson({"trash", id});
    ASSERT_EQ(trashed["status"], 0) << trashed;
    EXPECT_FALSE(fs::exists(folder + "/other\xfe"));
    json removed = tamberJson({"rm", id});
    ASSERT_EQ(removed["status"], 0) << removed;
    EXPECT_EQ(removed["deleted"], id);

    // A folder, by its file-ID identifier.
    std::string badFolder = dir.makeDir("Documents/dir\xff");
    dir.writeFile("Documents/dir\xff/inside", "i");
    std::string folderID = idOf(badFolder);
    ASSERT_EQ(folderID.rfind("fid=", 0), 0u) << folderID;
    json listed = tamberJson({"ls", folderID});
    ASSERT_EQ(listed["status"], 0) << listed;
    EXPECT_EQ(listed["items"].size(), 1u) << listed;
    json folderRenamed = tamberJson({"rename", folderID, "dir\xfe\t"});
    ASSERT_EQ(folderRenamed["status"], 0) << folderRenamed;
    EXPECT_TRUE(fs::exists(storage + "/dir\xfe\t/inside"));
    json folderMoved = tamberJson({"mv", folderID, folder});
    ASSERT_EQ(folderMoved["status"], 0) << folderMoved;
    EXPECT_TRUE(fs::exists(folder + "/dir\xfe\t/inside"));
    json folderTrashed = tamberJson({"trash", folderID});
    ASSERT_EQ(folderTrashed["status"], 0) << folderTrashed;
    EXPECT_FALSE(fs::exists(folder + "/dir\xfe\t"));
    json folderRemoved = tamberJson({"rm", folderID});
    ASSERT_EQ(folderRemoved["status"], 0) << folderRemoved;

    // By path.
    std::string second = dir.writeFile("Documents/" + badName, "2");
    json renamedByPath = tamberJson({"rename", second, "x\xff\n"});
    ASSERT_EQ(renamedByPath["status"], 0) << renamedByPath;
    std::string now = storage + "/x\xff\n";
    ASSERT_TRUE(fs::exists(now));
    json movedByPath = tamberJson({"mv", now, folder});
    ASSERT_EQ(movedByPath["status"], 0) << movedByPath;
    std::string inFolder = folder + "/x\xff\n";
    ASSERT_TRUE(fs::exists(inFolder));
    json trashedByPath = tamberJson({"trash", inFolder});
    ASSERT_EQ(trashedByPath["status"], 0) << trashedByPath;
    EXPECT_FALSE(fs::exists(inFolder));
    std::string third = dir.writeFile("Documents/" + badName, "3");
    json removedByPath = tamberJson({"rm", third});
    ASSERT_EQ(removedByPath["status"], 0) << removedByPath;
    EXPECT_FALSE(fs::exists(third));
}

TEST(HostileTextTest, IllFormedUtf8IsReplacedPerSequenceAndEscapedPerByte) {
    const std::string fffd = "\xEF\xBF\xBD";
    EXPECT_TRUE(isValidUtf8("plain \xC3\xA9t\xC3\xA9 \xF0\x9F\x98\x80"));
    EXPECT_EQ(validUtf8("caf\xC3\xA9"), "caf\xC3\xA9");
    // A truncated sequence is one replacement; an overlong form, a surrogate or a lead byte
    // that can't start anything is one per byte.
    EXPECT_EQ(validUtf8("a\xE2\x82z"), "a" + fffd + "z");
    EXPECT_EQ(validUtf8("\xC0\xAF"), fffd + fffd);
    EXPECT_EQ(validUtf8("\xED\xA0\x80"), fffd + fffd + fffd);
    EXPECT_EQ(validUtf8("\xF4\x90\x80\x80"), fffd + fffd + fffd + fffd);
    EXPECT_EQ(validUtf8("end\xF0\x9F\x98"), "end" + fffd);
    EXPECT_FALSE(isValidUtf8("\xF0\x9F\x98"));

    EXPECT_EQ(escapedText("a b\\c\td\ne"), "a b\\\\c\\td\\ne");
    EXPECT_EQ(escapedText(std::string("\x01\x7F\0x", 4)), "\\001\\177\\000x");
    // C1 controls are controls too; a well-formed letter stays as it is.
    EXPECT_EQ(escapedText("\xC2\x85\xC3\xA9\xFF\xE2\x82("), "\\302\\205\xC3\xA9\\377\\342\\202(");
}

}  // namespace
}  // namespace tamber
