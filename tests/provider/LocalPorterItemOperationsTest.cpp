#include <gtest/gtest.h>

#include <functional>

#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/provider/ProviderOperationsTest.h"

namespace tamber {
namespace {

using namespace testing;
using ItemOperationsTest = ProviderOperationsTest;

TEST_F(ItemOperationsTest, NothingIsCreatedInOrMovedIntoTheRoot) {
    std::string source = writeFile(dir / "outside/report.txt");
    std::string file = writeFile(storage + "/Projects/plan.txt");
    HostPorterItemIdentifier fileID = identifierOf(file);
    const auto before = tree();
    const int resolutions = strata->resolutions();

    ItemOutcome imported, created, moved;
    porter->importDocumentAtURL(Url::fileURLWithPath(source), HostPorterRootContainerItemIdentifier,
                                imported.handler());
    porter->createDirectoryWithName("Drafts", HostPorterRootContainerItemIdentifier,
                                    created.handler());
    porter->reparentItemWithIdentifier(fileID, HostPorterRootContainerItemIdentifier, "plan.txt",
                                       moved.handler());
    for (ItemOutcome* outcome : {&imported, &created, &moved}) {
        EXPECT_EQ(outcome->calls, 1);
        EXPECT_FALSE(outcome->item);
        expectNoPermission(outcome->error);
    }
    EXPECT_EQ(tree(), before);
    // Refused before anything was even looked up.
    EXPECT_EQ(strata->resolutions(), resolutions);
}

TEST_F(ItemOperationsTest, UnknownIdentifiersFailWithoutTouchingAnything) {
    std::string source = writeFile(dir / "outside/report.txt");
    std::string file = writeFile(storage + "/Projects/plan.txt");
    HostPorterItemIdentifier fileID = identifierOf(file);
    HostPorterItemIdentifier folderID = identifierOf(storage + "/Projects");
    const HostPorterItemIdentifier unknown = "did=4242";
    const auto before = tree();

    ItemOutcome imported, created, renamed, movedItem, movedToUnknown;
    ErrorOutcome deleted;
    porter->importDocumentAtURL(Url::fileURLWithPath(source), unknown, imported.handler());
    porter->createDirectoryWithName("Drafts", unknown, created.handler());
    porter->renameItemWithIdentifier(unknown, "new.txt", renamed.handler());
    porter->reparentItemWithIdentifier(unknown, folderID, std::nullopt, movedItem.handler());
    porter->reparentItemWithIdentifier(fileID, unknown, std::nullopt, movedToUnknown.handler());
    porter->deleteItemWithIdentifier(unknown, deleted.handler());

    for (ItemOutcome* outcome : {&imported, &created, &renamed, &movedItem, &movedToUnknown}) {
        EXPECT_EQ(outcome->calls, 1);
        EXPECT_FALSE(outcome->item);
        expectNoSuchItem(outcome->error, unknown);
    }
    EXPECT_EQ(deleted.calls, 1);
    expectNoSuchItem(deleted.error, unknown);
    EXPECT_EQ(tree(), before);

    // An identifier whose file is gone is as unknown as one that never was.
    std::filesystem::remove(file);
    const auto afterRemoval = tree();
    ItemOutcome renamedGone;
    ErrorOutcome deletedGone;
    porter->renameItemWithIdentifier(fileID, "new.txt", renamedGone.handler());
    porter->deleteItemWithIdentifier(fileID, deletedGone.handler());
    EXPECT_EQ(renamedGone.calls, 1);
    expectNoSuchItem(renamedGone.error, fileID);
    EXPECT_EQ(deletedGone.calls, 1);
    expectNoSuchItem(deletedGone.error, fileID);
    EXPECT_EQ(tree(), afterRemoval);
}

TEST_F(ItemOperationsTest, ImportCopiesUnderAFreeNameAndLeavesTheSourceAlone) {
    std::string source = writeFile(dir / "outside/report.txt", "draft");
    std::string folder = makeFolder(storage + "/Projects");
    writeFile(folder + "/report.txt", "older");
    HostPorterItemIdentifier folderID = identifierOf(folder);

    ItemOutcome first, second;
    porter->importDocumentAtURL(Url::fileURLWithPath(source), folderID, first.handler());
    porter->importDocumentAtURL(Url::fileURLWithPath(source), folderID, second.handler());
    ASSERT_EQ(first.calls, 1);
    ASSERT_EQ(second.calls, 1);
    ASSERT_TRUE(first.item) << first.error->description();
    ASSERT_TRUE(second.item) << second.error->description();
    EXPECT_EQ(first.item->filename(), "report 2.txt");
    EXPECT_EQ(second.item->filename(), "report 3.txt");
    EXPECT_EQ(first.item->parentItemIdentifier(), folderID);
    EXPECT_NE(first.item->itemIdentifier(), second.item->itemIdentifier());
    EXPECT_EQ(namesIn(folder),
              (std::vector<std::string>{"report 2.txt", "report 3.txt", "report.txt"}));
    EXPECT_TRUE(std::filesystem::exists(source));
    std::ifstream older(folder + "/report.txt");
    EXPECT_EQ(std::string(std::istreambuf_iterator<char>(older), {}), "older");
    EXPECT_EQ(
        sectionsTitled("import document at \"" + source + "\" to parent \"" + folderID + "\""), 2u);
}

TEST_F(ItemOperationsTest, CreateBouncesAndRenameRefusesATakenName) {
    std::string folder = makeFolder(storage + "/Projects");
    HostPorterItemIdentifier folderID = identifierOf(folder);

    ItemOutcome first, second;
    porter->createDirectoryWithName("Drafts", folderID, first.handler());
    porter->createDirectoryWithName("Drafts", folderID, second.handler());
    ASSERT_TRUE(first.item && second.item);
    EXPECT_EQ(first.item->filename(), "Drafts");
    EXPECT_EQ(second.item->filename(), "Drafts 2");
    EXPECT_TRUE(second.item->isFolder());

    std::string file = writeFile(folder + "/a.txt", "a");
    writeFile(folder + "/b.txt", "b");
    HostPorterItemIdentifier fileID = identifierOf(file);
    ItemOutcome renamed, clash;
    porter->renameItemWithIdentifier(fileID, "c.txt", renamed.handler());
    ASSERT_EQ(renamed.calls, 1);
    ASSERT_TRUE(renamed.item) << renamed.error->description();
    EXPECT_EQ(renamed.item->filename(), "c.txt");
    // A rename keeps the document: same identifier.
    EXPECT_EQ(renamed.item->itemIdentifier(), fileID);

    strata->publish(folder + "/c.txt");
    const auto before = tree();
    porter->renameItemWithIdentifier(fileID, "b.txt", clash.handler());
    EXPECT_EQ(clash.calls, 1);
    EXPECT_FALSE(clash.item);
    ASSERT_TRUE(clash.error);
    EXPECT_EQ(clash.error->domain(), kPosixErrorDomain);
    EXPECT_EQ(clash.error->code(), EEXIST);
    EXPECT_EQ(tree(), before);
}

TEST_F(ItemOperationsTest, MoveKeepsTheNameUnlessGivenOneAndMayEnterAnAppLibrary) {
    std::string file = writeFile(storage + "/Projects/plan.txt", "plan");
    HostPorterItemIdentifier fileID = identifierOf(file);
    HostPorterItemIdentifier archiveID = identifierOf(makeFolder(storage + "/Archive"));

    ItemOutcome moved;
    porter->reparentItemWithIdentifier(fileID, archiveID, std::nullopt, moved.handler());
    ASSERT_EQ(moved.calls, 1);
    ASSERT_TRUE(moved.item) << moved.error->description();
    EXPECT_EQ(moved.item->filename(), "plan.txt");
    EXPECT_EQ(moved.item->parentItemIdentifier(), archiveID);
    EXPECT_EQ(namesIn(storage + "/Projects"), std::vector<std::string>{});
    EXPECT_EQ(namesIn(storage + "/Archive"), std::vector<std::string>{"plan.txt"});

    strata->publish(storage + "/Archive/plan.txt");
    ItemOutcome intoLibrary;
    porter->reparentItemWithIdentifier(fileID, kAppIdentifier, "notes.txt", intoLibrary.handler());
    ASSERT_EQ(intoLibrary.calls, 1);
    ASSERT_TRUE(intoLibrary.item) << intoLibrary.error->description();
    EXPECT_EQ(intoLibrary.item->filename(), "notes.txt");
    EXPECT_EQ(intoLibrary.item->parentItemIdentifier(), kAppIdentifier);
    EXPECT_EQ(intoLibrary.item->itemIdentifier(), fileID);
    EXPECT_EQ(namesIn(storage + "/Archive"), std::vector<std::string>{});
    std::ifstream in(library + "/notes.txt");
    EXPECT_EQ(std::string(std::istreambuf_iterator<char>(in), {}), "plan");
}

TEST_F(ItemOperationsTest, DeleteRemovesAFolderWithItsContentsButNeverAContainer) {
    std::string folder = makeFolder(storage + "/Old");
    writeFile(folder + "/inner/a.txt");
    HostPorterItemIdentifier folderID = identifierOf(folder);
    ErrorOutcome deleted;
    porter->deleteItemWithIdentifier(folderID, deleted.handler());
    EXPECT_EQ(deleted.calls, 1);
    EXPECT_FALSE(deleted.error);
    EXPECT_FALSE(std::filesystem::exists(folder));

    // The storage and the apps' libraries are never removed, whatever the host asks.
    writeFile(library + "/keep.txt");
    const auto before = tree();
    for (const HostPorterItemIdentifier& container : std::vector<HostPorterItemIdentifier>{
             HostPorterRootContainerItemIdentifier, kAppIdentifier}) {
        ErrorOutcome refused;
        porter->deleteItemWithIdentifier(container, refused.handler());
        EXPECT_EQ(refused.calls, 1);
        expectNoPermission(refused.error);
    }
    EXPECT_EQ(tree(), before);
}

// A file-system call that fails anywhere in an operation, even after the change was made (when
// the record of the item it moved or made is read), leaves the tree as it was when the
// operation reports an error; the operation succeeds or fails, never both.
TEST_F(ItemOperationsTest, AFailureAnywhereInAnOperationLeavesTheTreeAsItWas) {
    using Op = FaultInjectingFileSystem::Operation;
    std::filesystem::create_directories(library + "/.Trash");
    std::string source = writeFile(dir / "outside/report.txt");
    HostPorterItemIdentifier into = identifierOf(makeFolder(library + "/Into"));
    auto faults = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    ScopedFileSystem scoped(faults);
    using Run = std::function<void(const HostPorterItemIdentifier&, LocalPorter::ItemCompletion)>;
    const std::vector<std::pair<std::string, Run>> operations = {
        {"trash", [&](auto id, auto done) { porter->trashItemWithIdentifier(id, done); }},
        {"rename",
         [&](auto id, auto done) { porter->renameItemWithIdentifier(id, "renamed.txt", done); }},
        {"move",
         [&](auto id, auto done) {
             porter->reparentItemWithIdentifier(id, into, std::nullopt, done);
         }},
        {"import",
         [&](auto, auto done) {
             porter->importDocumentAtURL(Url::fileURLWithPath(source), into, done);
         }},
        {"create", [&](auto, auto done) { porter->createDirectoryWithName("New", into, done); }},
    };
    int failures = 0;
    int file = 0;
    for (const auto& [name, operation] : operations) {
        for (Op op : {Op::Statx, Op::OpenBeneath, Op::Openat, Op::ReadDirectory, Op::Lgetxattr}) {
            for (int pass = 0; pass < 30; ++pass) {
                std::string path = writeFile(library + "/f" + std::to_string(++file) + ".txt");
                HostPorterItemIdentifier id = identifierOf(path);
                const auto before = tree();
                faults->injectAfter(op, EIO, pass);
                ItemOutcome outcome;
                operation(id, outcome.handler());
                bool reached = faults->pendingInjections() == 0;
                faults->clearInjections();
                ASSERT_EQ(outcome.calls, 1);
                if (outcome.error) {
                    ++failures;
                    EXPECT_EQ(tree(), before)
                        << name << " failed at call " << pass << " of "
                        << FaultInjectingFileSystem::operationName(op) << " and changed the tree";
                } else {
                    EXPECT_TRUE(outcome.item) << name;
                }
                if (!reached)
                    break;
            }
        }
    }
    EXPECT_GT(failures, 0) << "no injected failure reached an operation";
}

}  // namespace
}  // namespace tamber
