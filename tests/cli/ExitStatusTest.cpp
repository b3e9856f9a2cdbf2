#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <limits>
#include <nlohmann/json.hpp>
#include <sstream>
#include <stdexcept>

#include "cli/CommandLine.h"
#include "items/ItemMetadata.h"
#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "platform/tremors/TremorService.h"
#include "runtime/JsonValues.h"
#include "support/Log.h"
#include "support/StderrLogSink.h"
#include "tests/common/CliRunner.h"
#include "tests/common/CommandLineTest.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using nlohmann::json;
using testing::CliRun;
using testing::TempDir;
using Op = FaultInjectingFileSystem::Operation;

std::vector<std::string> linesOf(const std::string& text) {
    std::vector<std::string> lines;
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);) lines.push_back(line);
    return lines;
}

// What a script relies on: the exit status names the class of failure, and the failure is one
// line on standard error (or one JSON object on standard output with --json).
class ExitStatusTest : public testing::CommandLineTest {
protected:
    void SetUp() override {
        CommandLineTest::SetUp();
        file = dir.writeFile("Documents/a.txt", "a");
    }

    // Runs a verb that must fail with `status`: nothing on standard output, one line
    // "tamber: ..." on standard error that says what was wrong; returns that line.
    std::string failure(std::vector<std::string> args, int status) {
        std::string shown;
        for (const auto& a : args) shown += a + " ";
        CliRun run = tamber(args);
        EXPECT_EQ(run.status, status) << shown << run.err;
        EXPECT_TRUE(run.out.empty()) << shown << run.out;
        auto lines = linesOf(run.err);
        EXPECT_EQ(lines.size(), 1u) << shown << run.err;
        if (lines.empty())
            return {};
        EXPECT_EQ(lines[0].rfind("tamber: ", 0), 0u) << shown << lines[0];
        for (const char* vague : {"A parameter is invalid", "invalidItemIdentifier", "itemNotFound",
                                  "operation couldn't be completed"})
            EXPECT_EQ(lines[0].find(vague), std::string::npos) << shown << lines[0];
        return lines[0];
    }
    json jsonError(std::vector<std::string> args, int status) {
        args.push_back("--json");
        CliRun run = tamber(std::move(args));
        EXPECT_EQ(run.status, status) << run.out << run.err;
        EXPECT_TRUE(run.err.empty()) << run.err;
        json printed = json::parse(run.out, nullptr, false);
        EXPECT_TRUE(printed.contains("error")) << run.out;
        return printed.contains("error") ? printed["error"] : json();
    }
    std::string idOf(const std::string& path) {
        std::string id = tamber({"id", path}).out;
        return id.substr(0, id.find('\n'));
    }

    std::string file;
};

bool mentions(const std::string& line, const std::string& what) {
    return line.find(what) != std::string::npos;
}

TEST_F(ExitStatusTest, AFileIsNoContainerToListOrAnchor) {
    std::string id = idOf(file);
    ASSERT_EQ(id.rfind("did=", 0), 0u) << id;
    for (const std::string& name : {file, id}) {
        std::string line = failure({"ls", name}, 1);
        EXPECT_TRUE(mentions(line, "not a folder: " + id)) << line;
        EXPECT_TRUE(mentions(line, "a file can't be listed")) << line;
        EXPECT_TRUE(mentions(failure({"anchor", name}, 1), "not a folder")) << name;
        EXPECT_EQ(jsonError({"ls", name}, 1)["code"], ENOTDIR);
    }
    // A folder still lists.
    EXPECT_EQ(tamber({"ls", storage}).status, 0);
}

TEST_F(ExitStatusTest, WhatDoesNotExistExitsThree) {
    std::string missing = storage + "/missing.txt";
    EXPECT_TRUE(mentions(failure({"item", "did=987654321"}, 3), "no such item: did=987654321"));
    EXPECT_TRUE(mentions(failure({"item", "#com.example.absent"}, 3), "#com.example.absent"));
    EXPECT_TRUE(mentions(failure({"item", missing}, 3), missing));
    EXPECT_TRUE(mentions(failure({"ls", "fid=987654321"}, 3), "fid=987654321"));
    EXPECT_TRUE(mentions(failure({"anchor", missing}, 3), missing));
    EXPECT_TRUE(mentions(failure({"id", missing}, 3), missing));
    EXPECT_TRUE(mentions(failure({"rm", "did=987654321"}, 3), "did=987654321"));
    EXPECT_TRUE(mentions(failure({"tag", "did=987654321", "x"}, 3), "did=987654321"));
    EXPECT_TRUE(mentions(failure({"meta", missing}, 3), missing));
    json error = jsonError({"item", "did=987654321"}, 3);
    EXPECT_EQ(error["message"], "no such item: did=987654321") << error;
}

TEST_F(ExitStatusTest, UsageErrorsExitTwoAndNameTheOption) {
    EXPECT_TRUE(mentions(failure({"meta", file, "--set-rank", "x"}, 2),
                         "--set-rank takes an integer or \"none\", not \"x\""));
    EXPECT_TRUE(mentions(failure({"rank", file, "x"}, 2), "\"x\""));
    EXPECT_TRUE(mentions(failure({"ls"}, 2), "ID"));
    EXPECT_TRUE(mentions(failure({"no-such-verb"}, 2), "no-such-verb"));
    EXPECT_TRUE(mentions(failure({"ls", storage, "--no-such-option"}, 2), "--no-such-option"));
    failure({}, 2);
    EXPECT_TRUE(mentions(failure({""}, 2), "no such verb: \"\""));
    EXPECT_TRUE(mentions(failure({"purge-trash", "--older-than", "soon"}, 2), "soon"));
    // With --json the usage error is the JSON error too.
    json error = jsonError({"ls", storage, "--no-such-option"}, 2);
    EXPECT_TRUE(mentions(error["message"].get<std::string>(), "--no-such-option")) << error;
    // Nothing was changed by the refused verbs.
    EXPECT_FALSE(ItemMetadata::readFavoriteRank(Url::fileURLWithPath(file)));

    for (const char* flag : {"--help", "--version"}) {
        CliRun run = testing::runTamber({flag});
        EXPECT_EQ(run.status, 0) << flag << run.err;
        EXPECT_FALSE(run.out.empty()) << flag;
    }
    EXPECT_EQ(testing::runTamber({"ls", "--help"}).status, 0);
}

TEST_F(ExitStatusTest, AnUnreadableFolderFailsItsListing) {
    std::string locked = dir.makeDir("Documents/Locked");
    dir.writeFile("Documents/Locked/inside.txt");
    // Tests run as root, where permission bits don't stop a read: refuse it instead.
    auto faults = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped(faults);
    faults->inject(Op::ReadDirectory, EACCES, -1, "/Locked");

    std::string line = failure({"ls", locked}, 1);
    EXPECT_TRUE(mentions(line, locked)) << line;
    EXPECT_TRUE(mentions(line, std::strerror(EACCES))) << line;
    EXPECT_EQ(jsonError({"ls", locked, "--all"}, 1)["code"], EACCES);
    // Its siblings still list.
    CliRun root = tamber({"ls", storage});
    EXPECT_EQ(root.status, 0) << root.err;
    EXPECT_TRUE(mentions(root.out, "Locked")) << root.out;
}

TEST_F(ExitStatusTest, AFailedAttributeWriteFailsTheMetadataVerbs) {
    auto faults = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped(faults);
    faults->inject(Op::Fsetxattr, ENOTSUP, -1);
    faults->inject(Op::Fremovexattr, ENOTSUP, -1);

    for (const auto& args : std::vector<std::vector<std::string>>{{"tag", file, "Work"},
                                                                  {"tag", file},
                                                                  {"rank", file, "4"},
                                                                  {"rank", file, "none"},
                                                                  {"touch", file},
                                                                  {"touch", file, "--clear"}}) {
        std::string line = failure(args, 1);
        EXPECT_TRUE(mentions(line, std::strerror(ENOTSUP))) << line;
        json error = jsonError(args, 1);
        EXPECT_EQ(error["domain"], kPosixErrorDomain) << error;
        EXPECT_EQ(error["code"], ENOTSUP) << error;
    }
    faults->clearInjections();
    CliRun ok = tamber({"rank", file, "4", "--json"});
    EXPECT_EQ(ok.status, 0) << ok.err;
    EXPECT_EQ(json::parse(ok.out, nullptr, false)["favoriteRank"], 4) << ok.out;
}

TEST_F(ExitStatusTest, TagsDropEmptyAndRepeatedLabelsKeepingTheFirstOrder) {
    CliRun tagged = tamber({"tag", file, "b", "a", "", "b", "c", "a", "--json"});
    ASSERT_EQ(tagged.status, 0) << tagged.err;
    EXPECT_EQ(json::parse(tagged.out)["tags"], (json{"b", "a", "c"}));

    CliRun meta = tamber({"meta", file, "--set-tags", "a,,a,b,", "--json"});
    ASSERT_EQ(meta.status, 0) << meta.err;
    EXPECT_EQ(json::parse(meta.out)["tags"], (json{"a", "b"}));
    EXPECT_EQ(json::parse(tamber({"item", file, "--json"}).out)["tags"], (json{"a", "b"}));
}

TEST_F(ExitStatusTest, DatesWithoutACalendarDatePrintAsNull) {
    Url url = Url::fileURLWithPath(file);
    // A verb run installs the host's storage, inside which attributes may be written.
    ASSERT_EQ(tamber({"item", file}).status, 0);
    for (double seconds : {std::numeric_limits<double>::quiet_NaN(),
                           std::numeric_limits<double>::infinity(), 1e300, -1e300, 4e11}) {
        ASSERT_TRUE(ItemMetadata::writeLastUsedDate(url, Date::make(seconds)).ok());
        EXPECT_TRUE(dateJson(Date::make(seconds)).is_null()) << seconds;

        json item = json::parse(tamber({"item", file, "--json"}).out, nullptr, false);
        EXPECT_TRUE(item["lastUsedDate"].is_null()) << seconds << item;
        json meta = json::parse(tamber({"meta", file, "--json"}).out, nullptr, false);
        EXPECT_TRUE(meta["lastUsedDate"].is_null()) << seconds << meta;
        std::string text = tamber({"item", file}).out;
        EXPECT_TRUE(mentions(text, "lastUsedDate: -\n")) << text;
        EXPECT_FALSE(mentions(text, "invalid")) << text;
    }
    EXPECT_EQ(dateJson(Date::make(0.25)), "1970-01-01T00:00:00.250Z");
    EXPECT_EQ(dateJson(Date::make(1e10)), "2286-11-20T17:46:40.000Z");
    EXPECT_TRUE(dateJson(nullptr).is_null());
}

// Standard error as the process has it (file descriptor 2), captured into a file.
class CapturedStandardError {
public:
    CapturedStandardError() {
        path_ = dir_ / "stderr";
        int fd = ::open(path_.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
        saved_ = ::dup(STDERR_FILENO);
        ::dup2(fd, STDERR_FILENO);
        ::close(fd);
    }
    ~CapturedStandardError() { restore(); }
    std::string restore() {
        if (saved_ >= 0) {
            ::dup2(saved_, STDERR_FILENO);
            ::close(saved_);
            saved_ = -1;
        }
        std::ifstream in(path_);
        return std::string(std::istreambuf_iterator<char>(in), {});
    }

private:
    TempDir dir_;
    std::string path_;
    int saved_ = -1;
};

TEST_F(ExitStatusTest, LogLinesDoNotRepeatTheFailureOnStandardError) {
    auto run = [&](std::vector<std::string> args, std::string& written) {
        args.insert(args.begin(), {"tamber", "--storage", storage});
        std::vector<char*> argv;
        for (auto& a : args) argv.push_back(a.data());
        argv.push_back(nullptr);
        std::ostringstream out, err;
        // As on a machine without a system journal, where the log starts on standard error.
        auto previous = Log::shared().setSink(std::make_shared<StderrLogSink>());
        bool debug = Log::shared().debugEnabled();
        int status;
        {
            CapturedStandardError captured;
            status = runCommandLine(static_cast<int>(argv.size() - 1), argv.data(), out, err);
            written = captured.restore();
        }
        Log::shared().setSink(previous);
        Log::shared().setDebugEnabled(debug);
        EXPECT_TRUE(out.str().empty()) << out.str();
        return std::make_pair(status, err.str());
    };

    std::string logged;
    auto [status, err] = run({"item", "did=987654321"}, logged);
    EXPECT_EQ(status, 3);
    EXPECT_EQ(linesOf(err).size(), 1u) << err;
    EXPECT_TRUE(logged.empty()) << logged;

    // Asked for, the log lines are there, and the failure is still said once by the verb.
    std::tie(status, err) = run({"--verbose", "item", "did=987654321"}, logged);
    EXPECT_EQ(status, 3);
    EXPECT_EQ(linesOf(err).size(), 1u) << err;
    EXPECT_TRUE(mentions(logged, "[ERROR] item lookup failed")) << logged;
    EXPECT_FALSE(mentions(logged, "[DEBUG]")) << logged;
    std::tie(status, err) = run({"--debug", "item", "did=987654321"}, logged);
    EXPECT_TRUE(mentions(logged, "[DEBUG]")) << logged;
}

// A file system that throws where a system call would have failed: the command line must turn
// it into one line and status 1, not an abort.
class ThrowingFileSystem : public FaultInjectingFileSystem {
public:
    using FaultInjectingFileSystem::FaultInjectingFileSystem;
    int statx(int dirfd, const std::string& path, int flags, unsigned int mask,
              struct statx* out) override {
        if (path.find("boom") != std::string::npos)
            throw std::runtime_error("statx exploded");
        return FaultInjectingFileSystem::statx(dirfd, path, flags, mask, out);
    }
};

TEST_F(ExitStatusTest, AnExceptionBecomesOneInternalErrorLine) {
    std::string boom = dir.writeFile("Documents/boom.txt");
    testing::ScopedFileSystem scoped(
        std::make_shared<ThrowingFileSystem>(std::make_shared<LinuxFileSystem>()));
    CliRun run = tamber({"meta", boom});
    EXPECT_EQ(run.status, 1);
    EXPECT_EQ(linesOf(run.err), std::vector<std::string>{"tamber: internal error: statx exploded"})
        << run.err;
}

}  // namespace
}  // namespace tamber
