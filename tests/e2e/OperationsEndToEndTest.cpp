#include "platform/Tag.h"
#include "tests/e2e/EndToEndHost.h"

namespace tamber {
namespace {

using namespace testing;

// Every operation of the provider on a real storage folder and app library, then the files,
// their attributes, and what the change enumeration tells a host that had listed them before.
class OperationsEndToEndTest : public EndToEndHost {
protected:
    // Runs an item operation and waits for its one completion.
    template <class Operation>
    std::pair<LocalItemRef, std::optional<Error>> run(Operation operation) {
        std::pair<LocalItemRef, std::optional<Error>> result;
        DispatchSemaphore done;
        int calls = 0;
        operation([&](Result<HostPorterItemRef> item) {
            ++calls;
            if (item.ok())
                result.first = std::dynamic_pointer_cast<const LocalItem>(item.value());
            else
                result.second = item.error();
            done.signal();
        });
        EXPECT_TRUE(done.wait(10));
        EXPECT_EQ(calls, 1);
        return result;
    }
    LocalItemRef ok(std::pair<LocalItemRef, std::optional<Error>> result) {
        EXPECT_FALSE(result.second) << result.second->description();
        EXPECT_TRUE(result.first);
        return result.first;
    }
    std::optional<Error> remove(const HostPorterItemIdentifier& identifier) {
        std::optional<Error> error;
        DispatchSemaphore done;
        porter->deleteItemWithIdentifier(identifier, [&](Status status) {
            if (!status.ok())
                error = status.error();
            done.signal();
        });
        EXPECT_TRUE(done.wait(10));
        return error;
    }
};

TEST_F(OperationsEndToEndTest, EveryOperationShowsOnDiskAndInTheChangesThatFollow) {
    fs::create_directories(storage + "/Shared");
    std::string outside = dir.writeFile("outside/draft.txt", "draft");
    auto made =
        porter->enumeratorForContainerItemIdentifier(HostPorterWorkingSetContainerItemIdentifier);
    ASSERT_TRUE(made.ok());
    enumerator = made.value();
    HostPorterSyncAnchor anchor = currentAnchor();
    catchUp(anchor);
    listEverything();
    const HostPorterItemIdentifier libraryID = "#com.example.notes";
    auto shared = LocalItem::make(Url::fileURLWithPath(storage + "/Shared"));
    ASSERT_TRUE(shared);

    // Nothing is made in the root itself.
    auto refused = run([&](auto done) {
        porter->createDirectoryWithName("Reports", HostPorterRootContainerItemIdentifier, done);
    });
    ASSERT_TRUE(refused.second);
    EXPECT_EQ(refused.second->code(), kHostPlatformFileWriteNoPermission);
    EXPECT_FALSE(fs::exists(storage + "/Reports"));

    auto reports =
        ok(run([&](auto done) { porter->createDirectoryWithName("Reports", libraryID, done); }));
    ASSERT_TRUE(reports);
    auto draft = ok(run([&](auto done) {
        porter->importDocumentAtURL(Url::fileURLWithPath(outside), reports->itemIdentifier(), done);
    }));
    auto copy = ok(run([&](auto done) {
        porter->importDocumentAtURL(Url::fileURLWithPath(outside), reports->itemIdentifier(), done);
    }));
    ASSERT_TRUE(draft && copy);
    EXPECT_EQ(copy->filename(), "draft 2.txt");
    auto final = ok(run([&](auto done) {
        porter->renameItemWithIdentifier(copy->itemIdentifier(), "final.txt", done);
    }));
    ASSERT_TRUE(final);
    final = ok(run([&](auto done) {
        porter->reparentItemWithIdentifier(final->itemIdentifier(), shared->itemIdentifier(),
                                           std::nullopt, done);
    }));
    ASSERT_TRUE(final);
    EXPECT_EQ(final->fileURL().path(), storage + "/Shared/final.txt");
    EXPECT_EQ(final->itemIdentifier(), copy->itemIdentifier());  // the document kept its ID

    Bytes tags = GetTagsDataForTags({Tag::make("Work", 2), Tag::make("Travel", 5)});
    ok(run([&](auto done) { porter->setTagData(tags, final->itemIdentifier(), done); }));
    ok(run([&](auto done) {
        porter->setFavoriteRank(Number::fromUInt64(3), final->itemIdentifier(), done);
    }));
    auto used = ok(run(
        [&](auto done) { porter->setLastUsedDate(Date::now(), final->itemIdentifier(), done); }));
    ASSERT_TRUE(used);
    EXPECT_TRUE(used->lastUsedDate());
    ASSERT_TRUE(used->favoriteRank());
    EXPECT_EQ(used->favoriteRank()->uint64Value(), 3u);
    auto labels = GetTagsFromTagsData(used->tagData().value_or(Bytes{}));
    ASSERT_TRUE(labels);
    ASSERT_EQ(labels->size(), 2u);
    EXPECT_EQ((*labels)[0]->label(), "Work");
    EXPECT_EQ((*labels)[1]->colour(), 0);  // colours are not kept

    // Trash and put back, then trash for good and let the sweep take it.
    auto trashed =
        ok(run([&](auto done) { porter->trashItemWithIdentifier(draft->itemIdentifier(), done); }));
    ASSERT_TRUE(trashed);
    EXPECT_TRUE(trashed->isTrashed());
    EXPECT_EQ(trashed->fileURL().path(), library + "/.Trash/draft.txt");
    auto restored = ok(run([&](auto done) {
        porter->untrashItemWithIdentifier(draft->itemIdentifier(), std::nullopt, done);
    }));
    ASSERT_TRUE(restored);
    EXPECT_EQ(restored->fileURL().path(), library + "/Reports/draft.txt");
    EXPECT_FALSE(restored->isTrashed());
    ok(run([&](auto done) { porter->trashItemWithIdentifier(draft->itemIdentifier(), done); }));
    EXPECT_FALSE(remove(reports->itemIdentifier()));
    EXPECT_FALSE(fs::exists(library + "/Reports"));
    DispatchSemaphore swept;
    porter->_removeTrashedItemsOlderThanDate(Date::make(Date::now()->timeIntervalSince1970() + 60),
                                             [&] { swept.signal(); });
    ASSERT_TRUE(swept.wait(10));
    EXPECT_FALSE(fs::exists(library + "/.Trash/draft.txt"));

    catchUp(anchor);
    expectSameView(replica, disk(), "after the operations");
    EXPECT_TRUE(replica.contains(final->itemIdentifier()));
    EXPECT_FALSE(replica.contains(draft->itemIdentifier()));
    EXPECT_FALSE(replica.contains(reports->itemIdentifier()));
}

// The top level of a trash is in the working set, so what leaves it must leave the host's view
// too: folders and links are known by their file IDs, and only their path events tell of it.
TEST_F(OperationsEndToEndTest, WhatIsDeletedFromTheTrashLeavesTheHostsView) {
    fs::create_directories(library + "/Old/inner");
    write(library + "/Old/inner/note.txt", "note");
    fs::create_symlink("/etc/passwd", library + "/shortcut");
    auto made =
        porter->enumeratorForContainerItemIdentifier(HostPorterWorkingSetContainerItemIdentifier);
    ASSERT_TRUE(made.ok());
    enumerator = made.value();
    HostPorterSyncAnchor anchor = currentAnchor();
    listEverything();
    std::vector<HostPorterItemIdentifier> trashed;
    for (const char* name : {"Old", "shortcut"}) {
        auto item = LocalItem::make(Url::fileURLWithPath(library + "/" + name));
        ASSERT_TRUE(item);
        ok(run([&](auto done) { porter->trashItemWithIdentifier(item->itemIdentifier(), done); }));
        trashed.push_back(item->itemIdentifier());
    }
    TremorService::shared().value()->sync();
    catchUp(anchor);
    expectSameView(replica, disk(), "after trashing");
    ASSERT_TRUE(replica.contains(trashed[0]) && replica.contains(trashed[1]));

    EXPECT_FALSE(remove(trashed[0]));
    fs::remove(library + "/.Trash/shortcut");  // another program empties the trash
    TremorService::shared().value()->sync();
    catchUp(anchor);
    expectSameView(replica, disk(), "after deleting from the trash");
    EXPECT_FALSE(replica.contains(trashed[0]));
    EXPECT_FALSE(replica.contains(trashed[1]));
}

// What a trashed folder holds leaves the working set with it, and comes back when it is put back.
TEST_F(OperationsEndToEndTest, AFolderPutBackBringsItsContentsBack) {
    fs::create_directories(library + "/Old/inner");
    write(library + "/Old/inner/note.txt", "note");
    TremorService::shared().value()->sync();
    auto made =
        porter->enumeratorForContainerItemIdentifier(HostPorterWorkingSetContainerItemIdentifier);
    ASSERT_TRUE(made.ok());
    enumerator = made.value();
    HostPorterSyncAnchor anchor = currentAnchor();
    catchUp(anchor);
    listEverything();
    auto old = LocalItem::make(Url::fileURLWithPath(library + "/Old"));
    auto note = LocalItem::make(Url::fileURLWithPath(library + "/Old/inner/note.txt"));
    ASSERT_TRUE(old && note);
    ASSERT_TRUE(replica.contains(note->itemIdentifier()));

    ok(run([&](auto done) { porter->trashItemWithIdentifier(old->itemIdentifier(), done); }));
    TremorService::shared().value()->sync();
    catchUp(anchor);
    expectSameView(replica, disk(), "after trashing");
    EXPECT_FALSE(replica.contains(note->itemIdentifier()));

    ok(run([&](auto done) {
        porter->untrashItemWithIdentifier(old->itemIdentifier(), std::nullopt, done);
    }));
    TremorService::shared().value()->sync();
    catchUp(anchor);
    expectSameView(replica, disk(), "after putting back");
    EXPECT_TRUE(replica.contains(note->itemIdentifier()));
}

}  // namespace
}  // namespace tamber
