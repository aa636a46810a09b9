#include "programs/zel_server/moved_names.h"

#include <algorithm>
#include <set>
#include <utility>

#include "programs/zel_server/file_tree.h"

namespace zel_server {

namespace {

// The name of a path that begins at `at`, which goes to the next one.
std::string NextName(const std::string& path, size_t& at) {
    const size_t end = std::min(path.find('/', at), path.size());
    std::string name = path.substr(at, end - at);
    at = std::min(end + 1, path.size());
    return name;
}

// "rest" is what follows `at` in `path`.
std::string WithRest(const std::string& above, const std::string& path, size_t at) {
    return at < path.size() ? Below(above, path.substr(at)) : above;
}

}  // namespace

MovedNames::MovedNames() {
    root_.is_moved = true;
    root_.then = "";
    now_.emplace("", &root_);
}

MovedNames::Place& MovedNames::Make(const std::string& path) {
    Place* place = &root_;
    for (size_t at = 0; at < path.size();) {
        const std::string name = NextName(path, at);
        std::unique_ptr<Place>& below = place->below[name];
        if (!below) {
            below = std::make_unique<Place>();
            below->above = place;
            below->name = name;
        }
        place = below.get();
    }
    return *place;
}

void MovedNames::Forget(const Place& place) {
    if (place.is_moved && place.then) {
        now_.erase(*place.then);
    }
    for (const auto& [name, below] : place.below) {
        Forget(*below);
    }
}

std::string MovedNames::PathOf(const Place& place) {
    return place.above == nullptr ? "" : Below(PathOf(*place.above), place.name);
}

void MovedNames::Move(const std::string& from, const std::string& to) {
    auto then = Then(from);
    Place& source = Make(from);
    if (!source.is_moved) {
        source.is_moved = true;
        source.then = std::move(then);
        if (source.then) {
            now_.emplace(*source.then, &source);
        }
    }
    std::unique_ptr<Place>& left = source.above->below[source.name];
    std::unique_ptr<Place> moved = std::exchange(left, std::make_unique<Place>());
    left->above = moved->above;
    left->name = moved->name;
    left->is_moved = true;  // and nothing is there

    const Place& target = Make(to);
    Forget(target);
    moved->above = target.above;
    moved->name = target.name;
    std::unique_ptr<Place>& taken = moved->above->below[moved->name];
    taken = std::move(moved);
}

std::optional<std::string> MovedNames::Then(const std::string& path) const {
    const Place* place = &root_;
    const Place* moved = &root_;
    size_t rest = 0;
    for (size_t at = 0; at < path.size();) {
        const auto below = place->below.find(NextName(path, at));
        if (below == place->below.end()) {
            break;
        }
        place = below->second.get();
        if (place->is_moved) {
            moved = place;
            rest = at;
        }
    }
    return moved->then ? std::optional(WithRest(*moved->then, path, rest)) : std::nullopt;
}

std::optional<std::string> MovedNames::Now(const std::string& path) const {
    // What was moved farthest below decides.
    size_t end = path.size();
    auto moved = now_.find(path);
    while (moved == now_.end()) {
        const size_t slash = path.rfind('/', end - 1);
        end = slash == std::string::npos ? 0 : slash;
        moved = now_.find(path.substr(0, end));
    }
    const size_t rest = end == 0 ? 0 : std::min(end + 1, path.size());
    const Place* place = moved->second;
    for (size_t at = rest; at < path.size();) {
        const auto below = place->below.find(NextName(path, at));
        if (below == place->below.end()) {
            break;
        }
        place = below->second.get();
        if (place->is_moved) {
            return std::nullopt;
        }
    }
    return WithRest(PathOf(*moved->second), path, rest);
}

std::vector<std::string> MovedNames::PlacesOf(const std::string& path) const {
    if (path.empty()) {
        return {""};
    }
    std::set<std::string> all;
    if (auto now = Now(path)) {
        all.insert(*std::move(now));
    }
    const std::string below = path + "/";
    for (auto at = now_.lower_bound(below);
         at != now_.end() && at->first.compare(0, below.size(), below) == 0; ++at) {
        all.insert(PathOf(*at->second));
    }
    std::vector<std::string> places;
    for (const std::string& place : all) {
        std::string above = PathAbove(place);
        while (!above.empty() && all.count(above) == 0) {
            above = PathAbove(above);
        }
        if (above.empty()) {
            places.push_back(place);
        }
    }
    return places;
}

}  // namespace zel_server
