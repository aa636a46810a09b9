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
        const unsigned int names = 2 + seed % 11;
        Paths added;
        for (int i = seed % 3 == 0 ? 100000 : 60; i > 0; --i) {
            std::string path;
            for (auto depth = 1 + random() % 6; depth > 0; --depth) {
                path += "/" + std::to_string(random() % names);
            }
            added.push_back(path);
        }
        const Paths taken = Folded(added);
        EXPECT_LE(taken.size(), ChangeSet::kMaxHeld);
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
    // One path in each of many folders, the last first, beyond what is held; the deepest and the
    // closest are joined, and no more than need be.
    Paths folders;
    for (int i = 70000; i > 0; --i) {
        folders.push_back("/" + std::to_string(i % 20) + "/" + std::to_string(i) + "/x");
    }
    const Paths taken = Folded(folders + Paths{"/other"});
    EXPECT_THAT(taken, AllOf(Contains("/other"), Contains("/0"), SizeIs(Lt(65536u))));
    // Long names fill a set as well as many.
    const std::string long_name(200, 'n');
    Paths names;
    for (int i = 0; i < 60000; ++i) {
        names.push_back("/" + std::to_string(i % 3) + "/" + long_name + "/" + long_name +
                        std::to_string(i));
    }
    EXPECT_LT(Folded(names).size(), 50000u);
}

}  // namespace
