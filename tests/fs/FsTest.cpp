#include "tests/fs/FsTest.h"

#include <sys/stat.h>

#include <fstream>

namespace tamber::testing {

void RecordingReaderDelegate::record(TremorReader& reader, std::string report) {
    bool onQueue = reader.streamQueue()->isCurrent();
    waiter_.update([&] {
        if (!onQueue)
            ++offQueue_;
        reports_.push_back(std::move(report));
    });
}

void RecordingReaderDelegate::readerDidChange(TremorReader& reader, const LocalItemRef& item,
                                              const std::optional<Url>& url) {
    record(reader, "change " + item->itemIdentifier() + " " + (url ? url->path() : "-"));
}

void RecordingReaderDelegate::readerDidDelete(TremorReader& reader,
                                              const HostPorterItemIdentifier& identifier,
                                              const std::optional<Url>& url) {
    record(reader, "delete " + identifier + " " + (url ? url->path() : "-"));
}

void RecordingReaderDelegate::readerDidProcessHistory(TremorReader& reader) {
    record(reader, "history");
}

void RecordingReaderDelegate::readerMustRescan(TremorReader& reader) {
    record(reader, "rescan");
}

void RecordingReaderDelegate::readerDidFinishBatch(TremorReader& reader) {
    record(reader, "batch");
}

std::vector<std::string> RecordingReaderDelegate::reports() {
    std::lock_guard lock(waiter_.mutex());
    return reports_;
}

std::vector<std::string> RecordingReaderDelegate::itemReports() {
    std::vector<std::string> out;
    for (auto& report : reports())
        if (report != "batch")
            out.push_back(report);
    return out;
}

bool RecordingReaderDelegate::waitForReport(const std::string& report) {
    return waiter_.waitFor(
        [&] { return std::find(reports_.begin(), reports_.end(), report) != reports_.end(); });
}

bool RecordingReaderDelegate::waitForBatchWith(const std::string& report) {
    return waiter_.waitFor([&] {
        auto it = std::find(reports_.begin(), reports_.end(), report);
        return it != reports_.end() && std::find(it, reports_.end(), "batch") != reports_.end();
    });
}

void TremorTest::SetUp() {
    AppLibraryTest::SetUp();
    TremorService::resetForTesting();
    TremorService::configure(state_.path());
    storage_ = host->documentStorageURL().path();
    auto shared = TremorService::shared();
    ASSERT_TRUE(shared.ok()) << shared.error().description();
    ASSERT_TRUE(shared.value()->watchTree(storage_).ok());
}

void TremorTest::TearDown() {
    for (auto& reader : readers) reader->stop();
    readers.clear();
    TremorService::resetForTesting();
    TremorService::configure("");
    AppLibraryTest::TearDown();
}

std::shared_ptr<TremorService> TremorTest::service() {
    return TremorService::shared().value();
}

uint32_t TremorTest::device() {
    return service()->deviceForPath(storage_).value_or(0);
}

TremorStore& TremorTest::store() {
    TremorStore* store = service()->storeForDevice(device());
    EXPECT_NE(store, nullptr);
    return *store;
}

uint64_t TremorTest::journal(std::vector<JournalEvent> events) {
    service()->sync();
    auto last = store().append(events);
    EXPECT_TRUE(last.ok());
    return last.ok() ? last.value() : 0;
}

std::string TremorTest::write(const std::string& relative, const std::string& text) {
    std::string path = storage_ + "/" + relative;
    std::ofstream(path, std::ios::binary | std::ios::trunc) << text;
    return path;
}

uint64_t TremorTest::inodeOf(const std::string& path) {
    struct stat st {};
    EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
    return st.st_ino;
}

TremorReaderRef TremorTest::startReader(uint64_t since, TremorReaderMode mode,
                                        std::vector<Url> urls) {
    if (urls.empty())
        urls.push_back(storageURL());
    auto reader = TremorReader::make(std::move(urls), since, mode, true);
    reader->setDelegate(delegate);
    reader->start();
    readers.push_back(reader);
    return reader;
}

}  // namespace tamber::testing
