#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "host/HostPorterExtension.h"
#include "tests/model/ModelWorld.h"

namespace tamber::model {

// The steps of a model run. Step `index` of a seed is drawn from its own generator, so a list
// of step indices replays the same steps whichever others are dropped; a step whose target is
// missing (dropped with the step that made it) does nothing.
//
// Three families: changes made by another program with ordinary system calls, provider
// operations as a host calls them (some at once from several threads, some with a file-system
// call made to fail), and disturbances (a restart of the journal and provider, a dropped
// inotify queue).
class ModelSteps {
public:
    explicit ModelSteps(ModelWorld& world) : world_(world) {}

    // Families of steps that can be left out: "together" (operations at once), "fault",
    // "overflow", "restart". A step drawn from a left-out family is an outside change instead.
    static const std::vector<std::string>& families();
    void skip(const std::string& family) { skipped_.push_back(family); }
    // Lets an injected failure hit any thread's call (the journal's too), not only the calls
    // of the operation under test: a known gap, left out of runs unless asked for.
    void allowFaultsAnywhere() { faultsAnywhere_ = true; }
    // Operations an injected failure made fail, for the summary.
    int faultedFailures() const { return faultedFailures_; }

    // Runs one step; returns what it found wrong (empty when nothing). `description` says what
    // the step did, for the failure report.
    std::string run(uint64_t seed, uint64_t index, std::string& description);

    // Operations that reported an error although no fault was injected, for the summary.
    int unexpectedErrors() const { return unexpectedErrors_; }

    // A provider operation, planned against the model and run later.
    struct Operation {
        std::string description;
        // Starts the operation; `done` gets the item (or the error) once.
        std::function<void(HostPorterExtension::ItemCompletion done)> start;
        // Applies a success to the model and checks it; returns what is wrong.
        std::function<std::string(const std::string& path)> apply;
        std::vector<std::string> involved;  // paths it touches, for running others beside it
        bool mayFail = false;               // refusing it is a right answer
        // A deletion: one that fails part-way leaves what it had not removed yet (a known gap:
        // it is not undone, unlike the other operations).
        bool partial = false;
    };

private:
    // Outside changes.
    std::string outsideChange(Rng& rng, std::string& description);
    // Provider operations.
    Operation planOperation(Rng& rng);
    std::string runOne(Operation operation, bool faulted);
    std::string runTogether(std::vector<Operation> operations);
    // Disturbances.
    std::string restart(Rng& rng, std::string& description);
    std::string overflow(Rng& rng, std::string& description);
    std::string fault(Rng& rng, std::string& description);

    std::vector<std::string> folders(bool withRoots) const;
    std::vector<std::string> entries() const;  // neither a root nor in a trash
    std::vector<std::string> files() const;
    std::vector<std::string> trashed() const;  // tops of trashed trees
    std::string identifier(const std::string& path);
    // Takes out of the model what is no longer on disk at or below `path`.
    void forgetRemoved(const std::string& path);
    std::string pathOf(const Result<HostPorterItemRef>& item) const;

    ModelWorld& world_;
    int unexpectedErrors_ = 0;
    bool faulted_ = false;
    std::vector<std::string> skipped_;
    bool faultsAnywhere_ = false;
    int faultedFailures_ = 0;
    bool skipped(const std::string& family)
        const;         // a file-system call is made to fail in the running operation
    int counter_ = 0;  // makes outside sources and contents distinct
};

}  // namespace tamber::model
