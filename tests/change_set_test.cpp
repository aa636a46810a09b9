#include "programs/zel_daemon/change_set.h"
#include "tests/support/testing.h"

namespace {

using namespace testing;
using zel_daemon::ChangeSet;
using Paths = std::vector<std::string>;

Paths Folded(const Paths& added) {
    ChangeSet set;
    for (const std::string& path : added) {
        set.Add(path);
    }
    Paths taken = set.Take();
    EXPECT_TRUE(set.Empty());
    return taken;
}

/// `count` paths in a folder.
Paths Many(const std::string& folder, int count) {
    Paths paths;
    for (int i = 0; i < count; ++i) {
        paths.push_back(folder + "/" + std::to_string(i));
    }
    return paths;
}

Paths operator+(Paths one, const Paths& other) {
    one.insert(one.end(), other.begin(), other.end());
    return one;
}

TEST(ChangeSet, KeepsOnlyWhatNothingElseCovers) {
    const struct {
        Paths added, taken;
    } kCases[] = {
        {{}, {}},
        {{"/"}, {"/"}},
        {{"/a", "/a"}, {"/a"}},
        {{"/a/b", "/a"}, {"/a"}},
        {{"/a", "/a/b/c"}, {"/a"}},
        {{"/a/b", "/", "/c"}, {"/"}},
        {{"//a///b/", "/a/b"}, {"/a/b"}},
        // Names that begin alike, and bytes that sort around "/".
        {{"/a/b", "/a.b", "/a!", "/a\x01", "/ab"}, {"/a\x01", "/a!", "/a.b", "/a/b", "/ab"}},
        {{"/a!/x", "/a/x", "/a"}, {"/a", "/a!/x"}},
        {{"/\xff\n", "/\xff\n/x"}, {"/\xff\n"}},
    };
    for (const auto& [added, taken] : kCases) {
        EXPECT_EQ(Folded(added), taken) << testing::PrintToString(added);
    }
}

TEST(ChangeSet, TakesNoMoreThanSixteenAndJoinsTheDeepestFirst) {
    const Paths kSixteen = Many("/a/b", 16);
    EXPECT_EQ(Folded(kSixteen).size(), 16u);
    EXPECT_THAT(Folded(kSixteen + Paths{"/a/b/x"}), ElementsAre("/a/b"));
    // The deep folder goes; what lies wider apart stays.
    EXPECT_THAT(Folded(Many("/a/b/c", 8) + Paths{"/a/b2", "/x/1", "/x/2"} + Many("/y", 6)),
                ElementsAre("/a/b/c", "/a/b2", "/x/1", "/x/2", "/y/0", "/y/1", "/y/2", "/y/3",
                            "/y/4", "/y/5"));
    // Of equally deep ones the fullest, and no more than are needed.
    EXPECT_THAT(Folded(Many("/a", 3) + Many("/b", 12) + Many("/c", 2)),
                ElementsAre("/a/0", "/a/1", "/a/2", "/b", "/c/0", "/c/1"));
    // A joint within a joint: the inner one is not enough.
    EXPECT_THAT(Folded(Many("/a/b", 16) + Many("/a/b/c/d", 2) + Paths{"/a/c"}),
                ElementsAre("/a/b", "/a/c"));
    // Neighbours below names that begin alike share no folder but the whole.
    EXPECT_THAT(Folded(Many("/ab", 1) + Many("/a", 1) + Many("", 20)), ElementsAre("/"));
}

TEST(ChangeSet, AFloodCostsOnlyTheFolderThatItIsIn) {
    ChangeSet set;
    for (const std::string& path :
         Paths{"/a/b/c/1", "/a/b/c/2"} + Many("/log", ChangeSet::kMaxHeld * 3)) {
        set.Add(path);
    }
    EXPECT_THAT(set.Take(), ElementsAre("/a/b/c/1", "/a/b/c/2", "/log"));
}

/// Whatever is added in whatever order: all is covered, nothing twice, and folding is no more than
/// the bounds ask for.
TEST(ChangeSet, CoversAllThatWasAdded) {
    for (unsigned int seed = 0; seed < 30; ++seed) {
        std::mt19937 random(seed);
        const unsigned int names = 2 + seed % 7;
        Paths added;
        for (int i = seed % 3 == 0 ? 20000 : 60; i > 0; --i) {
            std::string path;
            for (auto depth = 1 + random() % 6; depth > 0; --depth) {
                path += "/" + std::to_string(random() % names);
            }
            added.push_back(path);
        }
        const Paths taken = Folded(added);
        EXPECT_LE(taken.size(), ChangeSet::kMaxTaken);
        EXPECT_TRUE(std::is_sorted(taken.begin(), taken.end()));
        const auto covers = [](const std::string& folder, const std::string& path) {
            return folder == "/" || path == folder || path.rfind(folder + "/", 0) == 0;
        };
        for (const std::string& path : added) {
            EXPECT_EQ(std::count_if(taken.begin(), taken.end(),
                                    [&](const std::string& one) { return covers(one, path); }),
                      1)
                << path << ", seed " << seed;
        }
    }
}

TEST(ChangeSet, DeepPathsAndHostileOrderDoNoHarm) {
    ChangeSet set;
    std::string deep;
    for (int i = 0; i < 100000; ++i) {
        deep += "/d";
    }
    set.Add(deep + "/x");
    set.Add(deep + "/y");
    EXPECT_THAT(set.Take(), ElementsAre(deep + "/x", deep + "/y"));
    // One path in each of many folders, the last first, again and again beyond what is held.
    Paths folders;
    for (int i = 50000; i > 0; --i) {
        folders.push_back("/" + std::to_string(i % 20) + "/" + std::to_string(i) + "/x");
    }
    EXPECT_EQ(Folded(folders + Paths{"/other"}).size(), 1u);
}

}  // namespace
