// A listing reads its entries relative to the folders it holds open. These tests hold it to
// what records built by path say, to the tree's boundary, and to the descriptors it may keep.
#include <gtest/gtest.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <filesystem>
#include <map>

#include "enumeration/LocalFileEnumerator.h"
#include "items/ItemMetadata.h"
#include "items/LocalItem.h"
#include "platform/TypeIdentifiers.h"
#include "platform/objects/Number.h"
#include "tests/enumeration/EnumerationTest.h"

namespace tamber {
namespace {

using testing::EnumerationTest;

class KeepingObserver : public HostPorterEnumerationObserver {
public:
    void didEnumerateItems(const std::vector<HostPorterItemRef>& more) override {
        items.insert(items.end(), more.begin(), more.end());
    }
    void finishEnumeratingUpToPage(const std::optional<HostPorterPage>& page) override {
        next = page;
    }
    void finishEnumeratingWithError(const Error& e) override { error = e; }
    std::vector<HostPorterItemRef> items;
    std::optional<HostPorterPage> next;
    std::optional<Error> error;
};

size_t openDescriptors() {
    size_t count = 0;
    for ([[maybe_unused]] const auto& entry : std::filesystem::directory_iterator("/proc/self/fd"))
        ++count;
    return count;
}

std::string describe(const std::shared_ptr<const Object>& value) {
    return value ? value->description() : "none";
}

// Everything a record says, as text, so that two records compare field by field.
std::map<std::string, std::string> fieldsOf(const LocalItem& item) {
    auto bytes = [](const std::optional<Bytes>& b) {
        return b ? std::string(b->begin(), b->end()) : std::string("none");
    };
    return {
        {"id", item.itemIdentifier()},
        {"parent", item.parentItemIdentifier()},
        {"name", item.filename()},
        {"type", item.typeIdentifier()},
        {"capabilities", std::to_string(item.capabilities())},
        {"size", describe(item.documentSize())},
        {"children", describe(item.childItemCount())},
        {"created", describe(item.creationDate())},
        {"modified", describe(item.contentModificationDate())},
        {"lastUsed", describe(item.lastUsedDate())},
        {"tags", bytes(item.tagData())},
        {"rank", describe(item.favoriteRank())},
        {"trashed", item.isTrashed() ? "yes" : "no"},
        {"fileID", item.fileID() ? std::to_string(*item.fileID()) : "none"},
        {"path", item.fileURL().path()},
    };
}

class ListingReadsTest : public EnumerationTest {
protected:
    std::vector<HostPorterItemRef> listAll(const HostPorterItemIdentifier& container,
                                           const std::string& folder) {
        auto enumerator =
            LocalFileEnumerator::initWithContainer(container, {Url::fileURLWithPath(folder)});
        enumerators.push_back(enumerator);
        std::vector<HostPorterItemRef> all;
        HostPorterPage page = HostPorterInitialPageSortedByName();
        for (;;) {
            auto observer = std::make_shared<KeepingObserver>();
            enumerator->enumerateItemsForObserver(observer, page);
            EXPECT_FALSE(observer->error) << observer->error->description();
            all.insert(all.end(), observer->items.begin(), observer->items.end());
            if (observer->error || !observer->next)
                return all;
            page = *observer->next;
        }
    }
};

TEST_F(ListingReadsTest, ListedRecordsSayWhatRecordsBuiltByPathSay) {
    std::string mix = dir.makeDir("s/mix");
    std::string tagged = dir.writeFile("s/mix/tagged.txt", "twelve bytes");
    ASSERT_TRUE(ItemMetadata::writeTagData(Url::fileURLWithPath(tagged),
                                           ItemMetadata::tagDataForLabels({"Red", "Work"}))
                    .ok());
    ASSERT_TRUE(
        ItemMetadata::writeFavoriteRank(Url::fileURLWithPath(tagged), Number::fromInt64(7)).ok());
    dir.writeFile("s/mix/sub/a");
    dir.writeFile("s/mix/sub/b");
    dir.writeFile("s/mix/Deck.lumen/page");
    dir.writeFile("s/mix/plain");
    // Enough entries for several pages, so that later pages resume from a kept walk (a
    // package's contents are not listed).
    for (int i = 0; i < 450; ++i) dir.writeFile("s/mix/many/f" + std::to_string(1000 + i));

    for (const auto& [container, root] :
         {std::pair<HostPorterItemIdentifier, std::string>{"fid=1", mix},
          {HostPorterAllDirectoriesContainerItemIdentifier, mix}}) {
        auto listed = listAll(container, root);
        ASSERT_EQ(listed.size(), container == "fid=1" ? 5u : 5u + 2 + 450) << container;
        size_t compared = 0;
        for (const auto& entry : listed) {
            auto item = std::dynamic_pointer_cast<const LocalItem>(entry);
            ASSERT_TRUE(item);
            auto byPath = LocalItem::make(Url::fileURLWithPath(item->fileURL().path()));
            ASSERT_TRUE(byPath) << item->fileURL().path();
            EXPECT_EQ(fieldsOf(*item), fieldsOf(*byPath)) << item->fileURL().path();
            ++compared;
        }
        EXPECT_EQ(compared, listed.size());
    }
}

TEST_F(ListingReadsTest, ALinkIsListedAsItselfAndNothingBehindItIsRead) {
    std::string outsideFile = dir.writeFile("outside/secret.txt", "secret");
    std::string outsideFolder = dir.makeDir("outside/folder");
    dir.writeFile("outside/folder/deep.txt");
    // A desktop tag on the target: a listing that followed the link would show it.
    ASSERT_EQ(::setxattr(outsideFile.c_str(), "user.xdg.tags", "Secret", 6, 0), 0);
    std::string links = dir.makeDir("s/links");
    std::filesystem::create_symlink(outsideFile, links + "/to-file");
    std::filesystem::create_symlink(outsideFolder, links + "/to-folder");
    dir.writeFile("s/links/real.txt");

    for (const auto& container :
         {HostPorterItemIdentifier("fid=1"),
          HostPorterItemIdentifier(HostPorterAllDirectoriesContainerItemIdentifier)}) {
        auto listed = listAll(container, links);
        std::vector<std::string> names;
        for (const auto& entry : listed) {
            names.push_back(entry->filename());
            if (entry->filename().starts_with("to-")) {
                EXPECT_EQ(entry->typeIdentifier(), TypeIdentifiers::kSymbolicLink);
                EXPECT_FALSE(entry->tagData()) << "the link's target was read";
                EXPECT_FALSE(entry->documentSize() && entry->documentSize()->uint64Value() == 6u);
            }
        }
        // The walk never descends through the link to the folder outside.
        EXPECT_EQ(names, (std::vector<std::string>{"real.txt", "to-file", "to-folder"}))
            << container;
    }
}

TEST_F(ListingReadsTest, RecordsAndKeptWalksHoldNoDescriptors) {
    for (int i = 0; i < 30; ++i) dir.writeFile("s/t/d" + std::to_string(i) + "/f");
    for (int i = 0; i < 450; ++i) dir.writeFile("s/flat/f" + std::to_string(1000 + i));
    // Warm everything that opens once for the process (journal, databases, caches).
    (void)listAll("fid=1", storage + "/flat");
    const size_t before = openDescriptors();

    auto flat = listAll("fid=1", storage + "/flat");
    auto tree = listAll(HostPorterAllDirectoriesContainerItemIdentifier, storage + "/t");
    ASSERT_EQ(flat.size(), 450u);
    ASSERT_EQ(tree.size(), 60u);
    // Held records still answer, by path now that their folders are closed.
    auto item = std::dynamic_pointer_cast<const LocalItem>(flat.back());
    ASSERT_TRUE(item);
    EXPECT_FALSE(item->fileURL().openFolder());
    EXPECT_TRUE(item->fileURL().resourceValue(ResourceKeys::kFileSize).ok());
    EXPECT_EQ(openDescriptors(), before);

    // A walk stopped in the middle of a page keeps its place, not its folders.
    auto enumerator =
        LocalFileEnumerator::initWithContainer("fid=1", {Url::fileURLWithPath(storage + "/flat")});
    enumerators.push_back(enumerator);
    auto observer = std::make_shared<KeepingObserver>();
    enumerator->enumerateItemsForObserver(observer, HostPorterInitialPageSortedByName());
    ASSERT_TRUE(observer->next);
    EXPECT_EQ(openDescriptors(), before);
}

}  // namespace
}  // namespace tamber
