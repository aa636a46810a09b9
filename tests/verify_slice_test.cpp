#include "programs/zel_daemon/verify_slice.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <random>

#include "tests/support/testing.h"

namespace zel_daemon {
namespace {

namespace fs = std::filesystem;

class SliceTest : public testing::Test {
protected:
    Slice Take(const std::string& place, const SliceLimits& limits) const {
        return TakeSlice(folder_.Path("share"), place, limits, [] { return false; });
    }
    std::vector<std::string> TakeAll(const SliceLimits& limits) const {
        std::vector<std::string> files;
        std::string place;
        for (Slice slice; !slice.is_last; place = slice.end) {
            slice = Take(place, limits);
            EXPECT_TRUE(slice.is_last || ComesBefore(place, slice.end)) << place;
            EXPECT_LE(slice.files.size(), limits.files);
            EXPECT_TRUE(slice.bytes <= limits.bytes || slice.files.size() == 1);
            files.insert(files.end(), slice.files.begin(), slice.files.end());
        }
        return files;
    }
    test::TempFolder folder_;
};

TEST_F(SliceTest, SlicesOfAnySizeHaveEachFileOnceAndInOrder) {
    std::minstd_rand random(3);
    std::vector<std::string> made;
    for (int i = 0; i < 200; ++i) {
        const char* const names[] = {"a", "a.b", "a-", "b", "\xff", " ", "#"};
        std::string path = "share";
        for (unsigned long depth = random() % 4; depth > 0; --depth) {
            path += std::string("/") + names[random() % 7] + "d";
        }
        path += std::string("/") + names[random() % 7] + std::to_string(random() % 40);
        folder_.Write(path, std::string(random() % 30, 'x'));
        made.push_back(path.substr(6));
    }
    fs::create_directories(folder_.Path("share/empty/folders"));
    folder_.Write("share/.zel_versions/1", "the service's own");
    folder_.Write("share/ad/.tarqrsync-partial/1", "the service's own");
    folder_.Write("outside/secret", "x");
    fs::create_symlink(folder_.Path("outside"), folder_.Path("share/link"));
    std::sort(made.begin(), made.end(), ComesBefore);
    made.erase(std::unique(made.begin(), made.end()), made.end());
    for (const SliceLimits& limits :
         {SliceLimits{1, 1}, SliceLimits{7, 50}, SliceLimits{1000, 5}, SliceLimits{1000, 100000}}) {
        EXPECT_EQ(TakeAll(limits), made) << limits.files << " " << limits.bytes;
    }
}

TEST_F(SliceTest, APlaceThatIsGoneOrHasBecomeAFolderIsGoneOnFrom) {
    for (const char* path : {"share/a", "share/b/c/d", "share/b/c/e", "share/b/f", "share/g"}) {
        folder_.Write(path, "x");
    }
    using testing::ElementsAre;
    fs::remove_all(folder_.Path("share/b/c"));
    EXPECT_THAT(Take("b/c/d", {9, 9}).files, ElementsAre("b/f", "g"));
    fs::remove_all(folder_.Path("share/b"));
    EXPECT_THAT(Take("b/c/d", {9, 9}).files, ElementsAre("g"));
    fs::remove(folder_.Path("share/a"));
    folder_.Write("share/a/new", "x");
    EXPECT_THAT(Take("a", {9, 9}).files, ElementsAre("a/new", "g"));
    EXPECT_THAT(Take("g", {9, 9}).files, ElementsAre());
    EXPECT_TRUE(Take("g", {9, 9}).is_last);
}

}  // namespace
}  // namespace zel_daemon
