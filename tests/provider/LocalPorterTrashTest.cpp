#include <gtest/gtest.h>

#include "items/ExtendedAttributes.h"
#include "items/ItemMetadata.h"
#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "platform/objects/String.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/provider/ProviderOperationsTest.h"

namespace tamber {
namespace {

using namespace testing;

class TrashTest : public ProviderOperationsTest {
protected:
    // Trashes the item at `path` and makes its new place resolvable; the trashed item.
    LocalItemRef trash(const std::string& path) {
        ItemOutcome outcome;
        porter->trashItemWithIdentifier(identifierOf(path), outcome.handler());
        EXPECT_EQ(outcome.calls, 1);
        EXPECT_TRUE(outcome.item) << (outcome.error ? outcome.error->description() : "");
        if (outcome.item)
            strata->publish(outcome.item->fileURL().path());
        return outcome.item;
    }
    ItemOutcome untrash(const HostPorterItemIdentifier& identifier,
                        std::optional<HostPorterItemIdentifier> parent = std::nullopt) {
        ItemOutcome outcome;
        porter->untrashItemWithIdentifier(identifier, parent, outcome.handler());
        EXPECT_EQ(outcome.calls, 1);
        return outcome;
    }
    static std::string contents(const std::string& path) {
        std::ifstream in(path);
        return std::string(std::istreambuf_iterator<char>(in), {});
    }
};

TEST_F(TrashTest, TrashGoesBesideTheFirstDocumentsAndRecordsWhenAndWhence) {
    // The storage is ".../home/Documents"; the item sits in a user folder also named Documents.
    std::string original = writeFile(storage + "/Projects/Documents/report.txt", "r");
    HostPorterItemIdentifier identifier = identifierOf(original);
    double before = Date::now()->timeIntervalSince1970();

    LocalItemRef item = trash(original);
    ASSERT_TRUE(item);
    double after = Date::now()->timeIntervalSince1970();
    EXPECT_EQ(item->fileURL().path(), storage + "/.Trash/report.txt");
    EXPECT_FALSE(std::filesystem::exists(original));
    EXPECT_FALSE(std::filesystem::exists(storage + "/Projects/Documents/.Trash"));
    EXPECT_TRUE(item->isTrashed());
    EXPECT_EQ(item->itemIdentifier(), identifier);
    EXPECT_EQ(contents(item->fileURL().path()), "r");

    auto trashDate = ItemMetadata::readTrashDate(item->fileURL());
    ASSERT_TRUE(trashDate);
    EXPECT_GE(trashDate->timeIntervalSince1970(), before);
    EXPECT_LE(trashDate->timeIntervalSince1970(), after);
    auto putBack = ItemMetadata::readPutBack(item->fileURL());
    ASSERT_TRUE(putBack);
    EXPECT_EQ(putBack->value(), "Projects/Documents/report.txt");
    EXPECT_EQ(item->putBackURL(), Url::fileURLWithPath(original));
    EXPECT_EQ(log->count("[DEBUG] trash is located at \"" + storage + "/.Trash\"", LogLevel::Debug),
              1u);
    EXPECT_EQ(log->countStartingWith("[ERROR]"), 0u);
}

TEST_F(TrashTest, TwoItemsOfTheSameNameBothStayInTheTrash) {
    std::string first = writeFile(library + "/a/notes.txt", "first");
    std::string second = writeFile(library + "/b/notes.txt", "second");
    LocalItemRef one = trash(first);
    LocalItemRef two = trash(second);
    ASSERT_TRUE(one && two);
    EXPECT_EQ(namesIn(library + "/.Trash"), (std::vector<std::string>{"notes 2.txt", "notes.txt"}));
    EXPECT_EQ(contents(library + "/.Trash/notes.txt"), "first");
    EXPECT_EQ(contents(library + "/.Trash/notes 2.txt"), "second");
    // Each remembers its own origin, relative to the app's library.
    EXPECT_EQ(ItemMetadata::readPutBack(one->fileURL())->value(), "a/notes.txt");
    EXPECT_EQ(ItemMetadata::readPutBack(two->fileURL())->value(), "b/notes.txt");
    EXPECT_EQ(two->putBackURL(), Url::fileURLWithPath(second));
}

TEST_F(TrashTest, TrashRefusalsLeaveEverythingInPlace) {
    ItemOutcome unknown;
    porter->trashItemWithIdentifier("did=4242", unknown.handler());
    EXPECT_EQ(unknown.calls, 1);
    expectNoSuchItem(unknown.error, "did=4242");

    ItemOutcome libraryItself;
    porter->trashItemWithIdentifier(kAppIdentifier, libraryItself.handler());
    EXPECT_EQ(libraryItself.calls, 1);
    expectNoPermission(libraryItself.error);
    EXPECT_TRUE(std::filesystem::is_directory(library));

    // A storage folder without a "Documents" component has nowhere to put a trash.
    std::string plain = dir.makeDir("plain");
    host->setStorageURL(Url::fileURLWithPath(plain));
    std::string file = writeFile(plain + "/sub/a.txt");
    HostPorterItemIdentifier identifier = identifierOf(file);
    const auto before = tree();
    log->clear();
    ItemOutcome outcome;
    porter->trashItemWithIdentifier(identifier, outcome.handler());
    EXPECT_EQ(outcome.calls, 1);
    EXPECT_FALSE(outcome.item);
    ASSERT_TRUE(outcome.error);
    EXPECT_EQ(outcome.error->code(), kHostPorterInvalidParameter);
    EXPECT_EQ(outcome.error->userInfo().at("parameter"), "sourceURL");
    EXPECT_EQ(log->count("[ERROR] no Documents directory found in path \"" + file + "\"",
                         LogLevel::Error),
              1u);
    EXPECT_EQ(tree(), before);
}

TEST_F(TrashTest, AttributeFailuresAreLoggedButTheItemIsTrashed) {
    std::string original = writeFile(library + "/sub/x.txt");
    HostPorterItemIdentifier identifier = identifierOf(original);
    auto faults = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    ScopedFileSystem scoped(faults);
    faults->inject(FaultInjectingFileSystem::Operation::Fsetxattr, ENOTSUP, -1);

    ItemOutcome outcome;
    porter->trashItemWithIdentifier(identifier, outcome.handler());
    EXPECT_EQ(outcome.calls, 1);
    ASSERT_TRUE(outcome.item) << outcome.error->description();
    EXPECT_FALSE(outcome.error);
    EXPECT_TRUE(outcome.item->isTrashed());
    EXPECT_TRUE(std::filesystem::exists(library + "/.Trash/x.txt"));
    EXPECT_FALSE(std::filesystem::exists(original));
    EXPECT_EQ(faults->calls(FaultInjectingFileSystem::Operation::Fsetxattr), 2u);
    std::string trashed = outcome.item->fileURL().absoluteString();
    EXPECT_EQ(log->countStartingWith("[ERROR] can't set xattr " + LocalItem::xattrTrashDateName() +
                                     " on " + trashed + "; "),
              1u);
    EXPECT_EQ(log->countStartingWith("[ERROR] couldn't set putback xattr (sub/x.txt) on " +
                                     trashed + "; "),
              1u);
    EXPECT_FALSE(ItemMetadata::readTrashDate(outcome.item->fileURL()));
}

TEST_F(TrashTest, UntrashingWhatIsNotTrashedIsAnInvalidParameter) {
    std::string file = writeFile(library + "/here.txt");
    HostPorterItemIdentifier identifier = identifierOf(file);
    const auto before = tree();
    ItemOutcome outcome = untrash(identifier);
    EXPECT_FALSE(outcome.item);
    ASSERT_TRUE(outcome.error);
    EXPECT_EQ(outcome.error->code(), kHostPorterInvalidParameter);
    EXPECT_EQ(outcome.error->userInfo().at("parameter"), "itemIdentifier");
    EXPECT_EQ(log->count("[DEBUG] item is not in trash", LogLevel::Debug), 1u);
    EXPECT_EQ(tree(), before);

    ItemOutcome unknown = untrash("did=4242");
    expectNoSuchItem(unknown.error, "did=4242");
}

TEST_F(TrashTest, UntrashReturnsToWhereTheItemCameFrom) {
    std::string original = writeFile(library + "/sub/x.txt", "x");
    LocalItemRef trashed = trash(original);
    ASSERT_TRUE(trashed);
    // Something took the name meanwhile: the returning item bounces, nothing is replaced.
    writeFile(original, "newer");

    ItemOutcome outcome = untrash(trashed->itemIdentifier());
    ASSERT_TRUE(outcome.item) << outcome.error->description();
    EXPECT_EQ(outcome.item->fileURL().path(), library + "/sub/x 2.txt");
    EXPECT_FALSE(outcome.item->isTrashed());
    EXPECT_EQ(outcome.item->itemIdentifier(), trashed->itemIdentifier());
    EXPECT_EQ(contents(original), "newer");
    EXPECT_EQ(contents(library + "/sub/x 2.txt"), "x");
    EXPECT_EQ(namesIn(library + "/.Trash"), std::vector<std::string>{});
    // The date goes, so that a sweep never finds it again; the put-back path may stay.
    EXPECT_FALSE(ReadXattrData(LocalItem::xattrTrashDateName(), outcome.item->fileURL()));
    EXPECT_EQ(log->count("[DEBUG] removing trash date xattr", LogLevel::Debug), 1u);
}

TEST_F(TrashTest, UntrashIntoAGivenParentUnlessItIsTrashed) {
    std::string original = writeFile(library + "/sub/x.txt");
    std::string other = makeFolder(library + "/other");
    std::string old = makeFolder(library + "/old");
    LocalItemRef trashedFolder = trash(old);
    ASSERT_TRUE(trashedFolder);

    LocalItemRef trashed = trash(original);
    ASSERT_TRUE(trashed);
    ItemOutcome intoTrashedParent =
        untrash(trashed->itemIdentifier(), trashedFolder->itemIdentifier());
    ASSERT_TRUE(intoTrashedParent.item) << intoTrashedParent.error->description();
    EXPECT_EQ(intoTrashedParent.item->fileURL().path(), original);
    EXPECT_EQ(namesIn(library + "/.Trash/old"), std::vector<std::string>{});
    EXPECT_EQ(log->countStartingWith("[DEBUG] can't use provided parent item " +
                                     trashedFolder->itemIdentifier() + " because it's trashed; "),
              1u);

    strata->publish(original);
    trashed = trash(original);
    ASSERT_TRUE(trashed);
    ItemOutcome intoOther = untrash(trashed->itemIdentifier(), identifierOf(other));
    ASSERT_TRUE(intoOther.item) << intoOther.error->description();
    EXPECT_EQ(intoOther.item->fileURL().path(), other + "/x.txt");
    EXPECT_FALSE(std::filesystem::exists(original));
}

TEST_F(TrashTest, UntrashFallsBackToTheLibraryRoot) {
    // The folder it came from is gone.
    std::string original = writeFile(library + "/sub/x.txt");
    LocalItemRef trashed = trash(original);
    ASSERT_TRUE(trashed);
    std::filesystem::remove_all(library + "/sub");
    ItemOutcome outcome = untrash(trashed->itemIdentifier());
    ASSERT_TRUE(outcome.item) << outcome.error->description();
    EXPECT_EQ(outcome.item->fileURL().path(), library + "/x.txt");
    EXPECT_EQ(outcome.item->parentItemIdentifier(), kAppIdentifier);
    EXPECT_EQ(log->countStartingWith("[DEBUG] putback url is not reachable; "), 1u);
    EXPECT_EQ(
        log->count("[DEBUG] use com.example.notes's root as recover location", LogLevel::Debug),
        1u);

    // A put-back path that climbs out of the library is not followed.
    strata->publish(outcome.item->fileURL().path());
    trashed = trash(outcome.item->fileURL().path());
    ASSERT_TRUE(trashed);
    ASSERT_TRUE(
        ItemMetadata::writePutBack(trashed->fileURL(), String::make("../../../y.txt")).ok());
    ItemOutcome escaped = untrash(trashed->itemIdentifier());
    ASSERT_TRUE(escaped.item) << escaped.error->description();
    EXPECT_EQ(escaped.item->fileURL().path(), library + "/x.txt");

    // Without any put-back path, the library root too.
    strata->publish(library + "/x.txt");
    trashed = trash(library + "/x.txt");
    ASSERT_TRUE(trashed);
    ASSERT_TRUE(ItemMetadata::writePutBack(trashed->fileURL(), nullptr).ok());
    log->clear();
    ItemOutcome bare = untrash(trashed->itemIdentifier());
    ASSERT_TRUE(bare.item) << bare.error->description();
    EXPECT_EQ(bare.item->fileURL().path(), library + "/x.txt");
    EXPECT_EQ(log->count("[DEBUG] no putback url", LogLevel::Debug), 1u);
}

}  // namespace
}  // namespace tamber
