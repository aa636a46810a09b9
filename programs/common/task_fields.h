// The table of a task's settings. From it come the store's columns, the checks of requests and
// files, the command-line options with their help, and what `task show` prints.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "ZEL/pobject.h"
#include "ZEL/sync_obj.h"

namespace programs {

enum class FieldKind {
    kText,
    kTexts,   ///< an array of texts
    kSwitch,  ///< 0 or 1; in files false or true
    kNumber
};

/// The upper bound of a number without a specific one.
constexpr uint64_t kAnyNumber = INT32_MAX;

/// One setting. The default of a setting that the library does not know is empty, `fallback` or
/// off.
struct TaskField {
    using Check = std::string (*)(const ZEL::PObject& value);
    using Words = std::string (*)(const ZEL::PObject& task);

    const char* key;  ///< in requests, replies and files; also the column name in the store
    FieldKind kind;
    const char* about;  ///< description in the help and in docs/daemon-protocol.md

    uint64_t min = 0;  ///< lower bound of a number; the default is always allowed, too
    uint64_t max = 0;
    uint64_t fallback = 0;  ///< default of a number that the library does not know
    Check check = nullptr;  ///< further check of the value; returns the fault or nothing
    bool required = false;  ///< must not be empty
    bool secret = false;    ///< only shown to users who may see passwords
    bool listed = false;    ///< included in a brief task
    bool leads = false;     ///< determines who receives the password
    int layout = 1;         ///< first version of the store's layout that has it

    const char* option = nullptr;   ///< on the command line, such as "-s,--server"; null: none
    const char* value = "";         ///< name of the value in the help
    const char* unless_given = "";  ///< default as shown in the help
    bool must_be_said = false;      ///< a new task needs the option
    /// Sets the settings for the option's argument, where that is more than the value of this
    /// field. Returns the fault of the argument, or nothing.
    using Take = std::string (*)(const TaskField& field, const std::string& word,
                                 ZEL::PObject& settings);
    Take take = nullptr;

    const char* label = nullptr;  ///< in `task show`; null: not shown
    Words words = nullptr;        ///< text shown there, if the plain value is not enough

    // Builder functions for the rows of the table.
    TaskField Required() const;
    TaskField Secret() const;
    TaskField Listed() const;
    TaskField Leads() const;
    TaskField Since(int store_layout) const;
    TaskField Default(uint64_t number) const;
    TaskField Checked(Check with) const;
    TaskField Option(const char* names, const char* value_word = "", const char* unless = "") const;
    TaskField Taken(Take by) const;
    TaskField MustBeSaid() const;
    TaskField Shown(const char* as, Words in = nullptr) const;
};

/// All settings, in the order in which they are shown.
const std::vector<TaskField>& TaskFields();
/// Null when there is no such setting.
const TaskField* FindTaskField(const std::string& key);

/// The settings of a task with nothing but defaults.
const ZEL::PObject& DefaultSettings();
/// The part of them that the library does not know.
const ZEL::PObject& OwnDefaults();

/// What is wrong with `value`, to follow the field's name: "must be a text". Empty when nothing is.
std::string FaultOf(const TaskField& field, const ZEL::PObject& value);
/// The field's name for people: "max_bandwidth (--bwlimit)".
std::string NameOf(const TaskField& field);
/// The field's row in docs/daemon-protocol.md.
std::string DocumentedRow(const TaskField& field);
/// The field's text in `task show`.
std::string WordsOf(const TaskField& field, const ZEL::PObject& task);

/// The server's name or address as entered by a person; a trusted server is registered under it.
std::string ServerOf(const ZEL::PObject& task);
std::string ServerOf(const ZEL::SyncInfo& info);
/// Whether both send their password to the same account of the same server, over the same
/// transport.
bool SameAccount(const ZEL::PObject& task, const ZEL::PObject& other);
/// The texts of an array.
std::vector<std::string> TextsOf(const ZEL::PObject& array);

}  // namespace programs
