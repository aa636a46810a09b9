// Walks the children of one map or array, for the loops that walk a whole value with a stack of
// their own.
#pragma once

#include "ZEL/pobject.h"

namespace ZEL {

/// A place in a container, starting before its first child. The container must outlive it,
/// unchanged.
class PObjectCursor {
public:
    explicit PObjectCursor(const PObject::Map& map) : map_(&map), entry_(map.begin()) {}
    explicit PObjectCursor(const PObject::Array& array) : array_(&array) {}
    /// REQUIRES container.isContainer().
    static PObjectCursor Of(const PObject& container) {
        return container.isMap() ? PObjectCursor(container.asMap())
                                 : PObjectCursor(container.asArray());
    }

    bool InMap() const { return map_ != nullptr; }
    /// True before the first child was taken.
    bool AtBegin() const { return InMap() ? entry_ == map_->begin() : index_ == 0; }
    bool AtEnd() const { return InMap() ? entry_ == map_->end() : index_ == array_->size(); }
    /// The key of the child that Take() gives next. REQUIRES InMap() && !AtEnd().
    const std::string& Key() const { return entry_->first; }
    /// The next child. REQUIRES !AtEnd().
    const PObject& Take() { return InMap() ? (entry_++)->second : (*array_)[index_++]; }

private:
    const PObject::Map* map_ = nullptr;
    const PObject::Array* array_ = nullptr;
    PObject::Map::const_iterator entry_;
    size_t index_ = 0;
};

}  // namespace ZEL
