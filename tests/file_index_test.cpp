// An index beside a map that is changed in the same way.
#include "programs/zel_daemon/file_index.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <iterator>
#include <map>
#include <random>
#include <set>
#include <string>
#include <vector>

#include "programs/zel_daemon/index_lookup.h"
#include "programs/zel_daemon/index_walk.h"
#include "programs/zel_daemon/path_key.h"
#include "tests/support/temp_root.h"

namespace zel_daemon {
namespace {

class FileIndexTest : public testing::Test {
protected:
    using Model = std::map<std::string, EntryFacts>;

    EntryFacts Facts(uint32_t mode) {
        EntryFacts facts;
        facts.mode = mode;
        facts.inode = ++last_inode_;
        facts.size = Random(1000);
        facts.modified = random_();
        facts.linked = S_ISREG(mode) && Random(50) == 0;
        return facts;
    }
    size_t Random(size_t below) { return random_() % below; }
    std::string Name() { return "n" + std::to_string(Random(4)); }
    /// One or two names, of few.
    std::string Place() {
        std::string path;
        for (size_t depth = 1 + Random(2); depth > 0; --depth) {
            path += "/" + Name();
        }
        return KeyOf(path);
    }
    static void Erase(Model& model, const std::string& key) {
        model.erase(model.lower_bound(key), model.lower_bound(key + '\x01'));
    }
    /// Some or many files in a folder.
    void Fill(Model& model, const std::string& folder) {
        Erase(model, folder);
        model[folder] = Facts(S_IFDIR | 0755);
        const size_t files = Random(3) == 0 ? 2500 + Random(1000) : Random(60);
        for (size_t i = 0; i < files; ++i) {
            model[folder + KeyOf("/file" + std::to_string(i))] = Facts(S_IFREG | 0644);
        }
    }
    /// The whole of the index, read in every way.
    void ExpectSame(const Model& model) {
        IndexWalk walk(index_);
        IndexLookup lookup(index_);
        std::map<uint64_t, std::string> linked;
        for (const auto& [key, facts] : model) {
            ASSERT_NE(walk.Entry(), nullptr) << PathOf(key);
            ASSERT_EQ(PathOf(walk.Entry()->key), PathOf(key));
            ASSERT_TRUE(IsUnchanged(walk.Entry()->facts, facts)) << PathOf(key);
            walk.Next();
            if (Random(10) == 0) {
                const EntryFacts* const found = lookup.Find(key);
                ASSERT_TRUE(found != nullptr && found->inode == facts.inode) << PathOf(key);
                ASSERT_EQ(lookup.Find(key + "x"), nullptr);
            }
            if (facts.linked) {
                ASSERT_EQ(index_.NamesOf(facts.inode), std::vector<std::string>{key});
            }
        }
        EXPECT_EQ(walk.Entry(), nullptr);
    }

    std::mt19937 random_{7};
    uint64_t last_inode_ = 0;
    const test::TempFolder root_;
    FileIndex index_{root_.Path("index/1/share")};
};

TEST_F(FileIndexTest, IsWhatWasNotedHoweverLargeFoldersAreMoved) {
    Model model;
    for (int i = 0; i < 12; ++i) {
        Fill(model, Place());
    }
    index_.Clear();
    for (const auto& [key, facts] : model) {
        index_.Append(key, facts);
    }
    index_.EndAppending();
    ExpectSame(model);
    for (int round = 0; round < 150 && !HasFatalFailure(); ++round) {
        SCOPED_TRACE(round);
        IndexChanges changes;
        Model next = model;
        const std::string from = Place();
        const std::string to = Place();
        if (!IsWithin(from, to) && !IsWithin(to, from)) {
            changes.Move(from, to);
            Erase(next, to);
            for (auto at = next.lower_bound(from); at != next.end() && IsWithin(at->first, from);
                 at = next.erase(at)) {
                next[to + at->first.substr(from.size())] = at->second;
            }
        }
        std::set<std::string> replaced;
        for (size_t i = Random(3); i > 0; --i) {
            replaced.insert(Place());
        }
        std::string last = "none";
        for (const std::string& key : replaced) {
            if (IsWithin(key, last)) {
                continue;
            }
            last = key;
            changes.Replace(key);
            Erase(next, key);
            Model now;
            if (Random(3) != 0) {
                Fill(now, key);
            }
            for (const auto& [put, facts] : now) {
                changes.Put(put, facts);
                next[put] = facts;
            }
        }
        const bool fails = Random(5) == 0;  // the share's own: all of it
        index_.Change(changes, fails ? std::vector<std::string>{""} : std::vector<std::string>(),
                      {});
        model = fails ? model : next;
        ExpectSame(model);
    }
}

}  // namespace
}  // namespace zel_daemon
