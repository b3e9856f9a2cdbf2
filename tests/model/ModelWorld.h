#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/apps/AppRegistry.h"
#include "tests/common/TempDir.h"
#include "tests/model/ModelHost.h"
#include "tests/model/ModelTree.h"

namespace tamber::model {

// A small deterministic generator (splitmix64), so that a step drawn from a seed and its index
// is the same step whichever other steps ran before it.
class Rng {
public:
    Rng(uint64_t seed, uint64_t index) : state_(seed * 0x9E3779B97F4A7C15ull + index + 1) {}
    uint64_t next();
    size_t below(size_t n) { return n ? next() % n : 0; }
    bool chance(unsigned percent) { return below(100) < percent; }
    template <class T>
    const T& pick(const std::vector<T>& from) {
        return from[below(from.size())];
    }

private:
    uint64_t state_;
};

// One model run's world: a temporary base folder holding the storage folder, two applications
// whose "Documents" libraries are published, an outside folder, the journal's state and a
// host over them; the model of what the disk should hold; and the checks that compare the
// three views (model, disk, host) after every step.
class ModelWorld {
public:
    static constexpr const char* kStorage = "Documents";
    static constexpr const char* kLibraryA = "apps/com.example.alpha/Documents";
    static constexpr const char* kLibraryB = "apps/com.example.beta/Documents";

    ModelWorld();
    ~ModelWorld();

    // Installs the applications and starts the host; empty on success.
    std::string start();

    std::string full(const std::string& relative) const { return base_.path() + "/" + relative; }
    // The path relative to the base folder; empty when `absolute` is outside it.
    std::string relative(const std::string& absolute) const;
    std::string outside() const { return outside_.path(); }

    ModelTree& tree() { return tree_; }
    ModelHost& host() { return *host_; }

    // The identifier the provider gives the entry at `relative` now; empty when none.
    std::string identifierAt(const std::string& relative);

    // Everything on disk under the roots, as the model describes entries (metadata aside),
    // and with every attribute, for telling whether a failed operation changed anything.
    struct DiskEntry {
        ModelNode::Kind kind;
        std::string contents;
        std::map<std::string, std::string> attributes;
        friend bool operator==(const DiskEntry&, const DiskEntry&) = default;
    };
    using Disk = std::map<std::string, DiskEntry>;
    Disk readDisk() const;
    static std::string describeDifference(const Disk& before, const Disk& after);

    // The checks after a step; empty when all hold.
    std::string check();

private:
    std::string checkDiskAgainstModel(const Disk& disk);
    std::string checkHost();
    Replica diskView(std::map<std::string, std::string>& identifiers);

    testing::TempDir base_;
    testing::TempDir outside_;
    testing::TempDir state_;
    testing::TempDir ledger_;
    std::string oldDataHome_;
    std::shared_ptr<AppRegistry> oldRegistry_;
    ModelTree tree_;
    std::unique_ptr<ModelHost> host_;
};

}  // namespace tamber::model
