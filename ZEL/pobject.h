// The service's dynamic value type.
//
// Every message between the service's processes is a PObject, and tasks are turned into PObjects
// and back. Reading never fails: a read of the wrong type gives 0, an empty string or a shared
// empty container. Writing turns the object into what is asked for.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <type_traits>
#include <vector>

namespace ZEL {

#pragma GCC visibility push(default)

class PStream;

/// Null, an unsigned 64-bit integer, a string, a map from string to PObject in byte-wise key order,
/// or an array of PObject. A value type: copies are deep, an object owns all that is below it.
///
/// Any depth of nesting can be copied, printed, sent and destroyed without deep recursion.
///
/// Threads: an object belongs to one thread at a time; objects that only are read may be shared.
///
/// Exceptions: a failed allocation throws std::bad_alloc and leaves the object as it was; the only
/// other exception is that of the non-const operator[](unsigned int).
class PObject {
public:
    using Array = std::vector<PObject>;
    using Map = std::map<std::string, PObject>;

    /// The numbers of the types.
    enum Type : int32_t {
        TYPE_NULL = 0,     ///< holds nothing
        TYPE_ARRAY = 1,    ///< holds an Array
        TYPE_MAP = 2,      ///< holds a Map
        TYPE_INTEGER = 3,  ///< holds an unsigned long long
        TYPE_STRING = 4    ///< holds a std::string, any bytes
    };

    /// `type_trait<T>::type` is the number of the type that holds a T.
    template <typename T>
    struct type_trait;

    /// Null.
    PObject() = default;
    PObject(unsigned long long value);
    PObject(const std::string& value);
    /// A null pointer gives the empty string.
    PObject(const char* value);
    /// Any other integer or bool, sign-extended to 64 bits.
    template <typename T, std::enable_if_t<std::is_integral_v<T>, int> = 0>
    PObject(T value) : PObject(static_cast<unsigned long long>(value)) {}
    /// A deep copy.
    PObject(const PObject& other);
    /// Takes the other's value; the other is null afterwards.
    PObject(PObject&& other) noexcept;
    ~PObject();

    // Assignments give the object a new value of that type and free the old one. The source may be
    // a part of the object's own value, as in `o = o["a"]`.
    PObject& operator=(unsigned long long value);
    PObject& operator=(int value);  ///< sign-extended: -1 is stored as 18446744073709551615
    PObject& operator=(unsigned int value);
    PObject& operator=(bool value);  ///< 0 or 1
    PObject& operator=(const std::string& value);
    PObject& operator=(const char* value);  ///< a null pointer gives the empty string
    PObject& operator=(const Array& value);
    PObject& operator=(const Map& value);
    template <typename T, std::enable_if_t<std::is_integral_v<T>, int> = 0>
    PObject& operator=(T value) {
        return *this = static_cast<unsigned long long>(value);
    }
    /// See copy(): assigning an object to itself leaves it null.
    PObject& operator=(const PObject& other);
    /// Takes the other's value, which is null afterwards, also when it is the object itself.
    PObject& operator=(PObject&& other) noexcept;

    /// Replaces the value by a deep copy of the other's. Copying an object onto itself leaves it
    /// null.
    void copy(const PObject& other);
    /// Exchanges the values of the two.
    void swap(PObject& other) noexcept;
    /// Frees the value: the object is null.
    void clear() noexcept;

    bool isNull() const { return value_ == nullptr; }
    bool isInteger() const { return type_ == TYPE_INTEGER; }
    bool isString() const { return type_ == TYPE_STRING; }
    bool isMap() const { return type_ == TYPE_MAP; }
    bool isArray() const { return type_ == TYPE_ARRAY; }
    bool isContainer() const { return isMap() || isArray(); }
    bool isPrimitive() const { return isString() || isInteger(); }
    /// True for null, for a string of length 0 and for a container without elements; false for an
    /// integer.
    bool isEmpty() const;
    /// True only for a map that holds `key`.
    bool hasMember(const std::string& key) const;

    // The integer, cut to the width: the low bits, read as signed where the result is signed. 0 for
    // any other type.
    unsigned long long asUInt64() const;
    unsigned long long asInteger() const { return asUInt64(); }
    long long asInt64() const { return static_cast<long long>(asUInt64()); }
    uint32_t asUInt32() const { return static_cast<uint32_t>(asUInt64()); }
    int32_t asInt32() const { return static_cast<int32_t>(asUInt32()); }
    uint16_t asUInt16() const { return static_cast<uint16_t>(asUInt64()); }
    int16_t asInt16() const { return static_cast<int16_t>(asUInt16()); }
    uint8_t asUInt8() const { return static_cast<uint8_t>(asUInt64()); }
    int8_t asInt8() const { return static_cast<int8_t>(asUInt8()); }
    /// An integer: is it not 0? Anything else: is it not empty? The string "0" is true, null is
    /// false.
    bool asBool() const;
    /// The string; for an integer the decimal text of its low 32 bits only; otherwise empty.
    std::string asString() const;
    /// The map, or the shared empty one.
    const Map& asMap() const;
    /// The array, or the shared empty one.
    const Array& asArray() const;
    /// The entry of a map, or the shared null object when there is none or this is no map.
    const PObject& operator[](const std::string& key) const;
    /// The element of an array, or the value of a map's entry in key order, counted from 0; the
    /// shared null object past the end and for any other type.
    const PObject& operator[](unsigned int index) const;

    /// The map, after becoming an empty map if it was none.
    Map& asMap();
    /// The array, after becoming an empty array if it was none. Arrays grow by the vector's own
    /// operations.
    Array& asArray();
    /// The entry of that key, a new null one if it was missing, after becoming an empty map if it
    /// was none.
    PObject& operator[](const std::string& key);
    /// The value of a map's entry in key order, counted from 0. Throws std::out_of_range past the
    /// end, and for anything but a map, an array included.
    PObject& operator[](unsigned int index);

    /// One line of text: null, 5, "text" (nothing in it is escaped), [1, 2], {"a": 5, "b": []}.
    std::string toString() const;

    // The shared empties: what reads of the wrong type refer to. They live until exit and are never
    // changed.
    static const PObject& GetEmptyObject();
    static const Map& GetEmptyMap();
    static const Array& GetEmptyArray();

private:
    friend class PStream;  // receives into the value that an object holds already

    template <typename T>
    bool holds() const {
        return type_ == type_trait<T>::type;
    }
    // The value; REQUIRES holds<T>().
    template <typename T>
    const T& get() const {
        return *static_cast<const T*>(value_);
    }
    template <typename T>
    T& get() {
        return *static_cast<T*>(value_);
    }
    // The value, after becoming an empty T if it was of another type.
    template <typename T>
    T& become();
    // Replaces the value; the new one is complete before the old one is freed.
    template <typename T>
    PObject& copy(T value);

    PObject* findContainer();
    PObject* firstSlot();
    void clearByLoop() noexcept;
    void deleteValue() noexcept;

    int32_t type_ = TYPE_NULL;
    void* value_ = nullptr;  // owned: null, or a heap object of the type
};

template <>
struct PObject::type_trait<PObject::Array> {
    static constexpr Type type = TYPE_ARRAY;
};
template <>
struct PObject::type_trait<PObject::Map> {
    static constexpr Type type = TYPE_MAP;
};
template <>
struct PObject::type_trait<unsigned long long> {
    static constexpr Type type = TYPE_INTEGER;
};
template <>
struct PObject::type_trait<std::string> {
    static constexpr Type type = TYPE_STRING;
};

template <typename T>
T& PObject::become() {
    if (!holds<T>()) {
        T* fresh = new T();
        if (!isNull()) {
            clear();
        }
        value_ = fresh;
        type_ = type_trait<T>::type;
    }
    return get<T>();
}

#pragma GCC visibility pop

}  // namespace ZEL
