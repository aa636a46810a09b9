#include "ZEL/pobject.h"

#include <algorithm>
#include <stdexcept>
#include <utility>

#include "ZEL/internal/pobject_cursor.h"

namespace ZEL {

namespace {

// Containers are freed by recursion, which is fast, down to this many levels, and by a loop below
// them.
constexpr int kLevelsByRecursion = 32;
thread_local int levels_being_freed = 0;

}  // namespace

PObject::PObject(unsigned long long value)
    : type_(TYPE_INTEGER), value_(new unsigned long long(value)) {}

PObject::PObject(const std::string& value) : type_(TYPE_STRING), value_(new std::string(value)) {}

PObject::PObject(const char* value)
    : type_(TYPE_STRING), value_(new std::string(value == nullptr ? "" : value)) {}

// A work list instead of recursion, so that deeply nested values can be copied. The delegated
// constructor completes the object first, so that the destructor runs when an allocation fails.
PObject::PObject(const PObject& other) : PObject() {
    std::vector<std::pair<const PObject*, PObject*>> containers;
    const auto copy_one = [&containers](const PObject& from, PObject& to) {
        switch (from.type_) {
            case TYPE_INTEGER:
                to.copy<unsigned long long>(from.get<unsigned long long>());
                break;
            case TYPE_STRING:
                to.copy<std::string>(from.get<std::string>());
                break;
            case TYPE_MAP:
            case TYPE_ARRAY:
                containers.emplace_back(&from, &to);
                break;
            default:
                break;
        }
    };
    copy_one(other, *this);
    while (!containers.empty()) {
        const auto [from, to] = containers.back();
        containers.pop_back();
        if (from->isMap()) {
            Map& target = to->become<Map>();
            for (const auto& [key, value] : from->get<Map>()) {
                copy_one(value, target.emplace_hint(target.end(), key, PObject())->second);
            }
        } else {
            const Array& source = from->get<Array>();
            Array& target = to->become<Array>();
            target.resize(source.size());
            for (size_t i = 0; i < source.size(); ++i) {
                copy_one(source[i], target[i]);
            }
        }
    }
}

PObject::PObject(PObject&& other) noexcept {
    swap(other);
}

PObject::~PObject() {
    if (!isNull()) {
        clear();
    }
}

template <typename T>
PObject& PObject::copy(T value) {
    T* fresh = new T(std::move(value));
    clear();
    value_ = fresh;
    type_ = type_trait<T>::type;
    return *this;
}

PObject& PObject::operator=(unsigned long long value) {
    return copy<unsigned long long>(value);
}

PObject& PObject::operator=(int value) {
    return copy<unsigned long long>(static_cast<unsigned long long>(value));
}

PObject& PObject::operator=(unsigned int value) {
    return copy<unsigned long long>(value);
}

PObject& PObject::operator=(bool value) {
    return copy<unsigned long long>(value ? 1 : 0);
}

PObject& PObject::operator=(const std::string& value) {
    return copy<std::string>(value);
}

PObject& PObject::operator=(const char* value) {
    return copy<std::string>(value == nullptr ? "" : value);
}

PObject& PObject::operator=(const Array& value) {
    return copy<Array>(value);
}

PObject& PObject::operator=(const Map& value) {
    return copy<Map>(value);
}

// NOLINTNEXTLINE(bugprone-unhandled-self-assignment): copy() makes null of it, as is documented
PObject& PObject::operator=(const PObject& other) {
    copy(other);
    return *this;
}

PObject& PObject::operator=(PObject&& other) noexcept {
    const bool itself = this == &other;
    PObject taken(std::move(other));
    if (!itself) {
        swap(taken);
    }
    return *this;
}

void PObject::copy(const PObject& other) {
    if (this == &other) {
        clear();
        return;
    }
    PObject fresh(other);
    swap(fresh);
}

void PObject::swap(PObject& other) noexcept {
    std::swap(type_, other.type_);
    std::swap(value_, other.value_);
}

void PObject::clear() noexcept {
    if (!isContainer()) {
        deleteValue();
    } else if (levels_being_freed < kLevelsByRecursion) {
        ++levels_being_freed;
        deleteValue();
        --levels_being_freed;
    } else {
        clearByLoop();
    }
}

// Frees a container of any depth without recursion and without allocating: on the way down, the
// slot that a child was taken from stores the parent, where the way up finds it again.
void PObject::clearByLoop() noexcept {
    PObject node;
    PObject parent;
    node.swap(*this);
    for (;;) {
        if (PObject* inner = node.findContainer()) {
            inner->swap(parent);
            parent.swap(node);
            continue;
        }
        node.deleteValue();
        if (parent.isNull()) {
            return;
        }
        node.swap(parent);
        node.firstSlot()->swap(parent);
    }
}

// Finds a child that is a container, starting at the end where removing is cheap, and removes the
// children that it passes, so that firstSlot() finds the same child again. Null, with nothing
// removed, when no child is a container.
PObject* PObject::findContainer() {
    if (isMap()) {
        Map& map = get<Map>();
        const auto found = std::find_if(
            map.begin(), map.end(), [](const auto& entry) { return entry.second.isContainer(); });
        if (found == map.end()) {
            return nullptr;
        }
        map.erase(map.begin(), found);
    } else {
        Array& array = get<Array>();
        const auto found = std::find_if(array.rbegin(), array.rend(),
                                        [](const auto& o) { return o.isContainer(); });
        if (found == array.rend()) {
            return nullptr;
        }
        array.erase(found.base(), array.end());
    }
    return firstSlot();
}

PObject* PObject::firstSlot() {
    return isMap() ? &get<Map>().begin()->second : &get<Array>().back();
}

// Frees the value, and containers below it by clear().
void PObject::deleteValue() noexcept {
    switch (type_) {
        case TYPE_ARRAY:
            delete &get<Array>();
            break;
        case TYPE_MAP:
            delete &get<Map>();
            break;
        case TYPE_INTEGER:
            delete &get<unsigned long long>();
            break;
        case TYPE_STRING:
            delete &get<std::string>();
            break;
        default:
            break;
    }
    type_ = TYPE_NULL;
    value_ = nullptr;
}

bool PObject::isEmpty() const {
    switch (type_) {
        case TYPE_INTEGER:
            return false;
        case TYPE_STRING:
            return get<std::string>().empty();
        case TYPE_MAP:
            return get<Map>().empty();
        case TYPE_ARRAY:
            return get<Array>().empty();
        default:
            return true;
    }
}

bool PObject::hasMember(const std::string& key) const {
    return isMap() && get<Map>().count(key) != 0;
}

unsigned long long PObject::asUInt64() const {
    return isInteger() ? get<unsigned long long>() : 0;
}

bool PObject::asBool() const {
    return isInteger() ? asUInt64() != 0 : !isEmpty();
}

std::string PObject::asString() const {
    if (isString()) {
        return get<std::string>();
    }
    return isInteger() ? std::to_string(asUInt32()) : std::string();
}

const PObject::Map& PObject::asMap() const {
    return isMap() ? get<Map>() : GetEmptyMap();
}

const PObject::Array& PObject::asArray() const {
    return isArray() ? get<Array>() : GetEmptyArray();
}

const PObject& PObject::operator[](const std::string& key) const {
    const Map& map = asMap();
    const auto entry = map.find(key);
    return entry == map.end() ? GetEmptyObject() : entry->second;
}

const PObject& PObject::operator[](unsigned int index) const {
    if (isArray()) {
        const Array& array = get<Array>();
        return index < array.size() ? array[index] : GetEmptyObject();
    }
    const Map& map = asMap();
    return index < map.size() ? std::next(map.begin(), index)->second : GetEmptyObject();
}

PObject::Map& PObject::asMap() {
    return become<Map>();
}

PObject::Array& PObject::asArray() {
    return become<Array>();
}

PObject& PObject::operator[](const std::string& key) {
    if (isMap()) {
        return get<Map>()[key];
    }
    // The key may be part of the value that is freed here.
    Map fresh;
    PObject& entry = fresh[key];
    become<Map>().swap(fresh);
    return entry;
}

PObject& PObject::operator[](unsigned int index) {
    if (!isMap() || index >= get<Map>().size()) {
        throw std::out_of_range("out_of_range: PObject::operator[]");
    }
    return std::next(get<Map>().begin(), index)->second;
}

std::string PObject::toString() const {
    std::string text;
    std::vector<PObjectCursor> open;
    const PObject* value = this;
    for (;;) {
        switch (value->type_) {
            case TYPE_NULL:
                text += "null";
                break;
            case TYPE_INTEGER:
                text += std::to_string(value->get<unsigned long long>());
                break;
            case TYPE_STRING:
                text.append(1, '"').append(value->get<std::string>()).append(1, '"');
                break;
            case TYPE_MAP:
            case TYPE_ARRAY:
                text += value->isMap() ? '{' : '[';
                open.push_back(PObjectCursor::Of(*value));
                break;
            default:
                break;
        }
        while (!open.empty() && open.back().AtEnd()) {
            text += open.back().InMap() ? '}' : ']';
            open.pop_back();
        }
        if (open.empty()) {
            return text;
        }
        PObjectCursor& place = open.back();
        if (!place.AtBegin()) {
            text += ", ";
        }
        if (place.InMap()) {
            text.append(1, '"').append(place.Key()).append("\": ");
        }
        value = &place.Take();
    }
}

const PObject& PObject::GetEmptyObject() {
    static const PObject empty;
    return empty;
}

const PObject::Map& PObject::GetEmptyMap() {
    static const Map empty;
    return empty;
}

const PObject::Array& PObject::GetEmptyArray() {
    static const Array empty;
    return empty;
}

}  // namespace ZEL
