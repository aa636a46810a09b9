// Where the names of one time are at a later one, after moves of files and of whole folders.
#pragma once

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace zel_server {

/// Paths are relative, without "..", "." and empty names; empty is the folder of all.
///
/// It knows the places of moves and no others, so it costs nothing where nothing was moved; each
/// question is logarithmic in the moves and linear in the path's length.
///
/// Threads: one thread.
class MovedNames {
public:
    MovedNames();

    /// One more move, in their order: what is at `from`, with all below it, goes to `to`, where
    /// nothing is by then.
    void Move(const std::string& from, const std::string& to);

    /// Where that is now which was at `path` then, if it is still there; nothing: its name belongs
    /// to something that was moved there.
    std::optional<std::string> Now(const std::string& path) const;
    /// Where that was then which is at `path` now, if it was there by then; nothing: it has come to
    /// a place from which something else has gone.
    std::optional<std::string> Then(const std::string& path) const;
    /// The places that now have all that was at `path` or below it then, none below another.
    /// Something else may be below them.
    std::vector<std::string> PlacesOf(const std::string& path) const;

private:
    struct Place {
        Place* above = nullptr;
        std::string name;
        std::map<std::string, std::unique_ptr<Place>> below;
        bool is_moved = false;  // it is not what the place above says
        std::optional<std::string> then;
    };
    Place& Make(const std::string& path);
    void Forget(const Place& place);
    static std::string PathOf(const Place& place);

    Place root_;
    std::map<std::string, const Place*> now_;  // by where they were then: places that were moved
};

}  // namespace zel_server
