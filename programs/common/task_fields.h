// A task's settings, each said once: from this table come the store's columns, the checks of
// requests and files, the command line with its help, and what people are shown.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "ZEL/pobject.h"

namespace programs {

enum class FieldKind {
    kText,
    kTexts,   ///< an array of texts
    kSwitch,  ///< 0 or 1; in files false or true
    kNumber
};

/// The upper bound of a number that needs none.
constexpr uint64_t kAnyNumber = INT32_MAX;

/// One setting. Until somebody says something else, one that the library does not know is empty, 0
/// or off.
struct TaskField {
    using Check = std::string (*)(const ZEL::PObject& value);
    using Words = std::string (*)(const ZEL::PObject& task);

    const char* key;  ///< in requests, replies and files, and the column's name in the store
    FieldKind kind;
    const char* about;  ///< what the help and docs/daemon-protocol.md say of it

    uint64_t min = 0;  ///< of a number; it may always be what it is when nobody says anything
    uint64_t max = 0;
    Check check = nullptr;  ///< what else is wrong with a value of the right kind, or nothing
    bool required = false;  ///< empty is no value
    bool secret = false;    ///< shown to those alone who may see passwords
    bool listed = false;    ///< a brief task has it
    int layout = 1;         ///< the store's layout that first had it

    const char* option = nullptr;   ///< on the command line, as "-s,--server"; null: none
    const char* value = "";         ///< what the help calls its value
    const char* unless_given = "";  ///< what the help says holds then
    /// What the option's word says, where that is more than the value of this field.
    void (*take)(const std::string& word, ZEL::PObject& settings) = nullptr;

    const char* label = nullptr;  ///< in `task show`; null: not there
    Words words = nullptr;  ///< what is shown there, where the value by itself tells too little

    // A row of the table is put together with these.
    TaskField Required() const;
    TaskField Secret() const;
    TaskField Listed() const;
    TaskField Since(int store_layout) const;
    TaskField Checked(Check with) const;
    TaskField Option(const char* names, const char* value_word = "", const char* unless = "") const;
    TaskField Taken(void (*by)(const std::string& word, ZEL::PObject& settings)) const;
    TaskField Shown(const char* as, Words in = nullptr) const;
};

/// All settings, in the order in which they are shown.
const std::vector<TaskField>& TaskFields();
/// Null for a key that is none of a task's.
const TaskField* FindTaskField(const std::string& key);

/// The settings of a task of which nobody has said anything.
const ZEL::PObject& DefaultSettings();
/// Those of them that the library does not know.
const ZEL::PObject& OwnDefaults();

/// What is wrong with `value`, behind the field's name: "must be a text". Empty when nothing is.
std::string FaultOf(const TaskField& field, const ZEL::PObject& value);
/// The field's name for people: "max_bandwidth (--bwlimit)".
std::string NameOf(const TaskField& field);
/// The line of docs/daemon-protocol.md about it.
std::string DocumentedRow(const TaskField& field);
/// What `task show` says of it.
std::string WordsOf(const TaskField& field, const ZEL::PObject& task);

/// The server's name, or its address.
std::string ServerOf(const ZEL::PObject& task);
/// The texts of an array.
std::vector<std::string> TextsOf(const ZEL::PObject& array);

}  // namespace programs
