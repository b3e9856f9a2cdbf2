// The model test: for each seed, a random run of outside changes, provider operations and
// disturbances against a temporary storage, checked after every step against a model of the
// tree and against a host that knows the tree only from listings and change enumerations.
//
//   model_tests [--first-seed N] [--seeds COUNT] [--length STEPS] [--minutes M] [--log FILE]
//   model_tests --seed N [--steps 3,7,12]     replays one seed, or only some of its steps
//   --skip FAMILY leaves out a family of steps (together, fault, overflow, restart); --debug
//   shows the debug lines with a failure;
//   --faults-anywhere lets an injected failure hit the journal's threads too (a known gap);
//   --trickle hands the journal one inotify event per read, splitting every burst;
//   --keep-going reports every failing seed without shrinking; --shrink-seconds S bounds the
//   time spent looking for a shorter failing list (300 s unless told).
//
// A failure prints the seed and the shortest list of its steps found that still fails.
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <fstream>
#include <iostream>
#include <mutex>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

#include "host/StagingCopies.h"
#include "support/Log.h"
#include "support/LogSink.h"
#include "tests/common/TempDir.h"
#include "tests/model/ModelSteps.h"
#include "tests/model/ModelWorld.h"

using namespace tamber;
using namespace tamber::model;

namespace {

// Keeps the last lines the program logged, shown with a failure.
class RecentLines : public LogSink {
public:
    void write(LogLevel, std::string_view line) override {
        std::lock_guard lock(mutex_);
        lines_.emplace_back(line);
        if (lines_.size() > limit)
            lines_.pop_front();
    }
    size_t limit = 40;
    std::string take() {
        std::lock_guard lock(mutex_);
        std::string out;
        for (const auto& line : lines_) out += "    " + line + "\n";
        lines_.clear();
        return out;
    }

private:
    std::mutex mutex_;
    std::deque<std::string> lines_;
};

struct Options {
    uint64_t firstSeed = 1;
    uint64_t seeds = 1;
    uint64_t length = 200;
    std::optional<std::vector<uint64_t>> steps;
    double minutes = 0;
    std::string log;
    bool debug = false;
    std::vector<std::string> skip;
    double shrinkSeconds = 300;
};

struct Outcome {
    bool failed = false;
    size_t at = 0;  // position in the step list of the failing step
    std::string report;
    int relists = 0;
    int unexpectedErrors = 0;
    int faultedFailures = 0;
};

std::vector<std::string> skippedFamilies;
bool verbose = false;  // prints every step
bool faultsAnywhere = false;
bool trickle = false;    // hands out inotify events one per read
bool keepGoing = false;  // reports each failing seed and goes on, without shrinking

Outcome runSeed(uint64_t seed, const std::vector<uint64_t>& steps) {
    Outcome outcome;
    ModelWorld world;
    world.host().inotify().trickle = trickle;
    ModelSteps runner(world);
    for (const auto& family : skippedFamilies) runner.skip(family);
    if (faultsAnywhere)
        runner.allowFaultsAnywhere();
    std::string failed = world.start();
    if (failed.empty())
        failed = world.check();
    if (!failed.empty()) {
        outcome = {true, 0, "before any step:" + failed};
        return outcome;
    }
    for (size_t i = 0; i < steps.size(); ++i) {
        std::string description;
        failed = runner.run(seed, steps[i], description);
        if (verbose)
            std::cout << "  step " << steps[i] << ": " << description << std::endl;
        if (failed.empty())
            failed = world.check();
        if (!failed.empty()) {
            outcome.failed = true;
            outcome.at = i;
            outcome.report =
                "step " + std::to_string(steps[i]) + " (" + description + "):" + failed;
            break;
        }
    }
    outcome.relists = world.host().relists();
    outcome.unexpectedErrors = runner.unexpectedErrors();
    outcome.faultedFailures = runner.faultedFailures();
    return outcome;
}

// Drops steps while the run still fails, in halving chunks, within a bounded number of runs
// and a bounded time: a failure that depends on timing would otherwise rerun long lists for
// many minutes (each run that passes only shows that the chunk was needed, or luck).
std::vector<uint64_t> shrink(uint64_t seed, std::vector<uint64_t> steps, double seconds) {
    const auto deadline = std::chrono::steady_clock::now() +
                          std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                              std::chrono::duration<double>(seconds));
    int runs = 0;
    auto more = [&] { return runs < 300 && std::chrono::steady_clock::now() < deadline; };
    for (size_t chunk = std::max<size_t>(steps.size() / 2, 1); chunk >= 1 && more();) {
        bool dropped = false;
        for (size_t start = 0; start + 1 < steps.size() && more();) {
            // The last step is the failing one: keep it.
            size_t end = std::min(start + chunk, steps.size() - 1);
            std::vector<uint64_t> fewer(steps.begin(), steps.begin() + long(start));
            fewer.insert(fewer.end(), steps.begin() + long(end), steps.end());
            ++runs;
            Outcome outcome = runSeed(seed, fewer);
            if (outcome.failed) {
                fewer.resize(outcome.at + 1);
                steps = fewer;
                dropped = true;
            } else {
                start = end;
            }
        }
        if (!dropped) {
            if (chunk == 1)
                break;
            chunk /= 2;
        }
    }
    return steps;
}

std::string join(const std::vector<uint64_t>& steps) {
    std::string out;
    for (uint64_t step : steps) out += (out.empty() ? "" : ",") + std::to_string(step);
    return out;
}

bool parse(int argc, char** argv, Options& options) {
    for (int i = 1; i < argc; ++i) {
        std::string arg = argv[i];
        auto value = [&]() -> std::string { return i + 1 < argc ? argv[++i] : ""; };
        try {
            if (arg == "--seed") {
                options.firstSeed = std::stoull(value());
                options.seeds = 1;
            } else if (arg == "--first-seed") {
                options.firstSeed = std::stoull(value());
            } else if (arg == "--seeds") {
                options.seeds = std::stoull(value());
            } else if (arg == "--length") {
                options.length = std::stoull(value());
            } else if (arg == "--minutes") {
                options.minutes = std::stod(value());
            } else if (arg == "--shrink-seconds") {
                options.shrinkSeconds = std::stod(value());
            } else if (arg == "--skip") {
                std::string family = value();
                const auto& known = ModelSteps::families();
                if (std::find(known.begin(), known.end(), family) == known.end()) {
                    std::cerr << "model_tests: --skip takes together, fault, overflow or restart\n";
                    return false;
                }
                options.skip.push_back(family);
            } else if (arg == "--faults-anywhere") {
                faultsAnywhere = true;
            } else if (arg == "--trickle") {
                trickle = true;
            } else if (arg == "--keep-going") {
                keepGoing = true;
            } else if (arg == "--verbose") {
                verbose = true;
            } else if (arg == "--debug") {
                options.debug = true;
            } else if (arg == "--log") {
                options.log = value();
            } else if (arg == "--steps") {
                std::vector<uint64_t> steps;
                std::stringstream list(value());
                for (std::string item; std::getline(list, item, ',');)
                    steps.push_back(std::stoull(item));
                options.steps = steps;
            } else {
                std::cerr << "model_tests: unknown option " << arg << "\n";
                return false;
            }
        } catch (const std::exception&) {
            std::cerr << "model_tests: " << arg << " needs a number\n";
            return false;
        }
    }
    return true;
}

}  // namespace

int main(int argc, char** argv) {
    Options options;
    if (!parse(argc, argv, options)) {
        std::cerr << "usage: model_tests [--first-seed N] [--seeds COUNT] [--length STEPS] "
                     "[--minutes M] [--log FILE] | --seed N [--steps LIST] [--debug] [--verbose] "
                     "[--faults-anywhere] [--keep-going] "
                     "[--shrink-seconds S] [--trickle]\n";
        return 2;
    }
    skippedFamilies = options.skip;
    auto recent = std::make_shared<RecentLines>();
    if (options.debug)
        recent->limit = 400;
    Log::shared().setSink(recent);
    Log::shared().setDebugEnabled(options.debug);
    tamber::testing::TempDir ledger;
    StagingCopies::setLedgerDirectoryForTesting(ledger.path());
    std::ofstream log;
    if (!options.log.empty())
        log.open(options.log, std::ios::app);

    const auto begun = std::chrono::steady_clock::now();
    auto elapsedMinutes = [&] {
        return std::chrono::duration<double>(std::chrono::steady_clock::now() - begun).count() / 60;
    };
    uint64_t seeds = 0, steps = 0, relists = 0, unexpected = 0, failures = 0, faulted = 0;
    for (uint64_t seed = options.firstSeed;; ++seed) {
        if (options.minutes > 0 ? elapsedMinutes() >= options.minutes
                                : seed >= options.firstSeed + options.seeds)
            break;
        std::vector<uint64_t> list = options.steps.value_or(std::vector<uint64_t>{});
        if (!options.steps)
            for (uint64_t i = 0; i < options.length; ++i) list.push_back(i);
        Outcome outcome = runSeed(seed, list);
        ++seeds;
        steps += outcome.failed ? outcome.at + 1 : list.size();
        relists += uint64_t(outcome.relists);
        unexpected += uint64_t(outcome.unexpectedErrors);
        faulted += uint64_t(outcome.faultedFailures);
        if (log.is_open())
            log << "seed " << seed << " steps " << list.size()
                << (outcome.failed ? " FAILED" : " ok") << std::endl;
        if (!outcome.failed) {
            recent->take();
            continue;
        }
        std::string lines = recent->take();
        list.resize(outcome.at + 1);
        if (keepGoing) {
            ++failures;
            std::cout << "model: seed " << seed << " failed at " << outcome.report.substr(0, 300)
                      << std::endl;
            continue;
        }
        // The report comes after the log lines: a CI excerpt shows the end of the output.
        std::cout << "  last log lines:\n"
                  << lines << "model: seed " << seed << " failed at " << outcome.report
                  << std::endl;
        std::string skips;
        for (const auto& family : options.skip) skips += " --skip " + family;
        if (faultsAnywhere)
            skips += " --faults-anywhere";
        if (trickle)
            skips += " --trickle";
        // A failure that does not come back on a replay depends on timing: shrinking it
        // would only measure luck, so it is reported with all its steps.
        Outcome again = runSeed(seed, list);
        std::vector<uint64_t> shortest = list;
        if (again.failed && !options.steps) {
            shortest = shrink(seed, list, options.shrinkSeconds);
            again = runSeed(seed, shortest);
        }
        bool whole = true;
        for (size_t i = 0; i < shortest.size(); ++i) whole = whole && shortest[i] == i;
        const std::string replay =
            whole ? "--length " + std::to_string(shortest.size()) : "--steps " + join(shortest);
        if (again.failed)
            std::cout << "  shortest failing steps (" << shortest.size()
                      << ") fail with: " << again.report << "\n";
        else
            std::cout << "  passed when run again: the failure depends on timing\n";
        std::cout << "  replay: model_tests --seed " << seed << " " << replay << skips << std::endl;
        if (log.is_open())
            log << "  replay: --seed " << seed << " " << replay << std::endl;
        return 1;
    }
    std::cout << "model: " << seeds << " seeds, " << steps << " steps, " << relists << " listings, "
              << faulted << " operations failed by an injected fault, " << unexpected
              << " refusals without a fault, "
              << (failures ? std::to_string(failures) + " failing seeds" : "no failure") << " ("
              << int(elapsedMinutes() * 60) << " s)" << std::endl;
    return failures ? 1 : 0;
}
