#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include "fs/TremorReader.h"
#include "fs/TremorReaderDelegate.h"
#include "platform/tremors/JournalEvent.h"
#include "platform/tremors/TremorService.h"
#include "platform/tremors/TremorStore.h"
#include "tests/common/AppLibraryTest.h"

namespace tamber::testing {

// Waits on a condition that other threads make true, for at most ten seconds.
class Waiter {
public:
    template <class F>
    bool waitFor(F&& condition) {
        std::unique_lock lock(mutex_);
        return changed_.wait_for(lock, std::chrono::seconds(10), condition);
    }
    template <class F>
    void update(F&& change) {
        {
            std::lock_guard lock(mutex_);
            change();
        }
        changed_.notify_all();
    }
    std::mutex& mutex() { return mutex_; }

private:
    std::mutex mutex_;
    std::condition_variable changed_;
};

// Every report, as a line: "change <id> <url or ->", "delete <id> <url or ->", "history",
// "rescan", "batch".
class RecordingReaderDelegate : public TremorReaderDelegate {
public:
    void readerDidChange(TremorReader& reader, const LocalItemRef& item,
                         const std::optional<Url>& url) override;
    void readerDidDelete(TremorReader& reader, const HostPorterItemIdentifier& identifier,
                         const std::optional<Url>& url) override;
    void readerDidProcessHistory(TremorReader& reader) override;
    void readerMustRescan(TremorReader& reader) override;
    void readerDidFinishBatch(TremorReader& reader) override;

    std::vector<std::string> reports();
    // The reports without the "batch" lines.
    std::vector<std::string> itemReports();
    bool waitForReport(const std::string& report);
    // Waits until `report` was followed by the end of its batch.
    bool waitForBatchWith(const std::string& report);
    // Reports made on another queue than the reader's.
    int offQueue() const { return offQueue_; }

private:
    void record(TremorReader& reader, std::string report);
    Waiter waiter_;
    std::vector<std::string> reports_;
    int offQueue_ = 0;
};

// A document storage folder watched by a tremor service on a temporary state directory, with
// the app-library set-up of AppLibraryTest. Events can be written straight into the journal, so
// that a stream replays exactly what a test wants.
class TremorTest : public AppLibraryTest {
protected:
    void SetUp() override;
    void TearDown() override;

    std::shared_ptr<TremorService> service();
    TremorStore& store();
    // Journals `events` (paths absolute, or "/.docid/..." for document-ID events); returns the
    // ID of the last one.
    uint64_t journal(std::vector<JournalEvent> events);
    uint64_t currentID() { return TremorReader::currentEventID(); }
    uint32_t device();
    std::string storagePath() const { return storage_; }
    Url storageURL() const { return Url::fileURLWithPath(storage_); }
    std::string write(const std::string& relative, const std::string& text = "x");
    static uint64_t inodeOf(const std::string& path);
    // A started reader over the storage with a recording delegate; stopped by TearDown.
    TremorReaderRef startReader(uint64_t since, TremorReaderMode mode = TremorReaderMode::pathBased,
                                std::vector<Url> urls = {});

    std::shared_ptr<RecordingReaderDelegate> delegate = std::make_shared<RecordingReaderDelegate>();
    std::vector<TremorReaderRef> readers;

private:
    TempDir state_;
    std::string storage_;
};

}  // namespace tamber::testing
