// How a planned operation is run (alone or beside others) and checked, and the disturbances:
// restarts, a lost inotify queue and a failing file-system call.
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <optional>
#include <thread>

#include "support/DispatchSemaphore.h"
#include "tests/model/ModelSteps.h"

namespace tamber::model {

namespace {

constexpr double kRunPatience = 60;  // seconds: only a hang gets near it

}  // namespace

std::string ModelSteps::runOne(Operation operation, bool faulted) {
    if (!operation.start)
        return "";
    ModelWorld::Disk before = world_.readDisk();
    std::optional<Result<HostPorterItemRef>> outcome;
    DispatchSemaphore done;
    int calls = 0;
    std::mutex mutex;
    operation.start([&](Result<HostPorterItemRef> item) {
        std::lock_guard lock(mutex);
        if (++calls == 1)
            outcome = std::move(item);
        done.signal();
    });
    if (!done.wait(kRunPatience))
        return "\n  the operation never finished";
    world_.host().faults().clearInjections();
    std::lock_guard lock(mutex);
    if (calls != 1)
        return "\n  the completion ran " + std::to_string(calls) + " times";
    if (!outcome->ok()) {
        if (!faulted && !operation.mayFail)
            ++unexpectedErrors_;
        faultedFailures_ += faulted;
        if (operation.partial) {
            for (const auto& path : operation.involved) forgetRemoved(path);
            return "";
        }
        std::string changed = ModelWorld::describeDifference(before, world_.readDisk());
        if (!changed.empty())
            return "\n  it failed (" + outcome->error().description() + ") and changed:" + changed;
        return "";
    }
    return operation.apply(pathOf(*outcome));
}

std::string ModelSteps::runTogether(std::vector<Operation> operations) {
    struct Finished {
        size_t which;
        Result<HostPorterItemRef> item;
    };
    std::mutex mutex;
    std::vector<Finished> finished;
    DispatchSemaphore done;
    for (size_t i = 0; i < operations.size(); ++i)
        operations[i].start([&, i](Result<HostPorterItemRef> item) {
            std::lock_guard lock(mutex);
            finished.push_back({i, std::move(item)});
            done.signal();
        });
    for (size_t i = 0; i < operations.size(); ++i)
        if (!done.wait(kRunPatience))
            return "\n  an operation never finished";
    std::lock_guard lock(mutex);
    if (finished.size() != operations.size())
        return "\n  a completion ran twice";
    // Applied in the order they finished: the later one named its result after the earlier.
    std::string out;
    for (auto& [which, item] : finished) {
        if (!item.ok()) {
            if (!operations[which].mayFail)
                ++unexpectedErrors_;
            continue;
        }
        out += operations[which].apply(pathOf(item));
    }
    return out;
}

std::string ModelSteps::restart(Rng& rng, std::string& description) {
    bool midEnumeration = rng.chance(50);
    description = midEnumeration ? "restart in the middle of a change enumeration" : "restart";
    world_.host().stop(midEnumeration);
    // Changes while nothing runs must be found when the journal comes back.
    if (rng.chance(50)) {
        std::string ignored;
        std::string failed = outsideChange(rng, ignored);
        description += ", with " + ignored + " while stopped";
        if (!failed.empty())
            return failed;
    }
    std::string failed = world_.host().start();
    return failed.empty() ? "" : "\n  the host did not start again: " + failed;
}

std::string ModelSteps::overflow(Rng& rng, std::string& description) {
    // The change is made while nothing is read, and then lost whole with the queue.
    OverflowingInotify& inotify = world_.host().inotify();
    inotify.hold = true;
    std::string change;
    std::string failed = outsideChange(rng, change);
    // A change that makes sure there is something to read, and so an overflow.
    std::string marker = world_.tree().roots()[0] + "/overflow " + std::to_string(++counter_);
    std::ofstream(world_.full(marker), std::ios::binary) << "marker\n";
    world_.tree().add(marker, ModelNode::file("marker\n"));
    inotify.overflowNext = true;
    inotify.hold = false;
    description = "inotify queue overflow, with " + change;
    return failed;
}

std::string ModelSteps::fault(Rng& rng, std::string& description) {
    using Op = FaultInjectingFileSystem::Operation;
    static const std::vector<int> errors = {ENOSPC, EIO, EACCES, ENOENT};
    Operation operation = planOperation(rng);
    auto op = Op(rng.below(FaultInjectingFileSystem::kOperationCount));
    // A known gap: a listing that fails inside the journal (which may read inotify on the
    // operation's thread) while an item is trashed costs the document its ID. Left out unless
    // --faults-anywhere; the provider's own failed listings are covered by its tests.
    if (op == Op::ReadDirectory && !faultsAnywhere_)
        op = Op::Statx;
    int error = rng.pick(errors);
    // Not the first call always: a fault in the middle of an operation is the harder case.
    int skip = int(rng.below(4));
    description = operation.description + ", with " +
                  std::string(FaultInjectingFileSystem::operationName(op)) + " failing (" +
                  std::strerror(error) + ") after " + std::to_string(skip) + " calls";
    if (!operation.start)
        return "";
    FaultInjectingFileSystem& faults = world_.host().faults();
    if (!faultsAnywhere_)
        faults.onlyOnThread(std::this_thread::get_id());
    faults.injectAfter(op, error, skip);
    faulted_ = true;
    std::string failed = runOne(std::move(operation), true);
    faulted_ = false;
    faults.onlyOnThread(std::nullopt);
    return failed;
}

}  // namespace tamber::model
