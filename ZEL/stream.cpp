#include "ZEL/stream.h"

#include <string.h>

#include <algorithm>
#include <array>
#include <list>
#include <new>
#include <optional>
#include <string_view>
#include <utility>

#include "ZEL/internal/pobject_cursor.h"
#include "ZEL/log.h"

namespace ZEL {

namespace {

// The value under this key (see sync_obj.h) is a password: it is kept out of the log.
constexpr std::string_view kPasswordKey = "pswd";

constexpr size_t kIndentLevels = 11;  // deeper levels of the trace are not indented further
constexpr char kIndent[] = "                      ";
static_assert(sizeof kIndent - 1 == 2 * kIndentLevels);

// A received string grows in steps of this many bytes: memory is used only as bytes arrive, not for
// an announced length.
constexpr size_t kStringStep = 4096;

// Room reserved for a new array: many have no more elements.
constexpr size_t kUsualLength = 4;

// Estimates of the memory that values take, the allocator's overhead included.
constexpr int64_t kAllocation = 16;
template <typename T>
constexpr int64_t kHeapMemory = sizeof(T) + kAllocation;
// A growing vector reserves up to twice the room that it needs.
constexpr int64_t kElementMemory = 2 * sizeof(PObject);
constexpr int64_t kArrayMemory = kUsualLength * sizeof(PObject) + kAllocation;
// The tree node of a map has four words in addition to the entry.
constexpr int64_t kEntryMemory = kHeapMemory<PObject::Map::value_type> + 4 * sizeof(void*);
// The shortest encoding of each, in bytes.
constexpr size_t kKeyBytes = 3;
template <typename T>
constexpr size_t kWireBytes = 2;
template <>
constexpr size_t kWireBytes<unsigned long long> = 3;
template <>
constexpr size_t kWireBytes<std::string> = 3;

// Levels kept without an allocation: most messages are not deeper.
constexpr size_t kUsualDepth = 8;

// A stack that allocates only beyond its first kFirst elements. Elements never move.
template <typename T, size_t kFirst>
class SteadyStack {
public:
    SteadyStack() = default;
    ~SteadyStack() {
        while (!IsEmpty()) {
            Pop();
        }
    }
    SteadyStack(const SteadyStack&) = delete;
    SteadyStack& operator=(const SteadyStack&) = delete;

    bool IsEmpty() const { return size_ == 0; }
    T& Top() { return size_ <= kFirst ? *first_[size_ - 1] : rest_.back(); }
    template <typename Argument>
    void Push(const Argument& argument) {
        if (size_ < kFirst) {
            first_[size_].emplace(argument);
        } else {
            rest_.emplace_back(argument);
        }
        ++size_;
    }
    void Pop() {
        --size_;
        if (size_ < kFirst) {
            first_[size_].reset();
        } else {
            rest_.pop_back();
        }
    }

private:
    std::array<std::optional<T>, kFirst> first_;
    std::list<T> rest_;
    size_t size_ = 0;
};

// Whether a channel operation succeeded; logs a failure.
bool Passed(int code) {
    if (code < 0) {
        Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] ZEL/stream(%d): Channel: %d\n", __LINE__,
                       code);
    }
    return code >= 0;
}

unsigned char IntegerLength(unsigned long long value) {
    if (value < 0x100) {
        return 1;
    }
    if (value < 0x10000) {
        return 2;
    }
    return value >> 32 == 0 ? 4 : 8;
}

// Decodes a big-endian number; only its low 64 bits are kept.
unsigned long long Fold(const char* bytes, unsigned int length) {
    unsigned long long value = 0;
    for (unsigned int i = 0; i < length; ++i) {
        value = value << 8 | static_cast<unsigned char>(bytes[i]);
    }
    return value;
}

}  // namespace

// A map entry that is being transferred; lives on the stack of the call that transfers it.
struct PStream::Entry {
    std::string_view key;
    Entry* outer = nullptr;
};

// Brings the key path up to date and returns the channel, for an operation that may block or fail.
// Whatever needs the ring buffers alone uses the channel's shortcuts instead.
inline Channel& PStream::Slowly(Channel& channel) {
    ShowPath();
    return channel;
}

// Single bytes.

inline bool PStream::WriteByte(Channel& channel, unsigned char value) {
    return channel.Store(&value, sizeof value) || Passed(Slowly(channel).WriteByte(value));
}

inline bool PStream::ReadByte(Channel& channel, unsigned char& value) {
    return channel.Fetch(&value, sizeof value) || Passed(Slowly(channel).ReadByte(&value));
}

// Decode the body of an integer or a string that is complete in the read ring.

inline bool PStream::Take(Channel& channel, unsigned long long& value) {
    const char* head = channel.Ahead(1);
    const unsigned int length = head == nullptr ? 0 : static_cast<unsigned char>(*head);
    const char* bytes = head == nullptr ? nullptr : channel.Ahead(1 + length);
    if (bytes == nullptr) {
        return false;
    }
    value = Fold(bytes + 1, length);
    channel.Took(1 + length);
    return true;
}

inline bool PStream::Take(Channel& channel, std::string& value) {
    const char* head = channel.Ahead(2);
    const size_t length = head == nullptr ? 0 : static_cast<size_t>(Fold(head, 2));
    const char* bytes = head == nullptr ? nullptr : channel.Ahead(2 + length);
    if (bytes == nullptr) {
        return false;
    }
    value.assign(bytes + 2, strnlen(bytes + 2, length));
    channel.Took(2 + length);
    return true;
}

inline void PStream::Enter(Entry& entry) {
    entry.outer = innermost_;
    innermost_ = &entry;
    ++entries_;
}

// Does nothing after KeepPath().
inline void PStream::Leave(const Entry& entry) {
    if (innermost_ != &entry) {
        return;
    }
    innermost_ = entry.outer;
    shown_ = std::min(shown_, --entries_);
    if (entries_ == 0 && history_.size() != kept_) {
        ShowPath();
    }
}

// Brings the history up to date.
void PStream::ShowPath() {
    if (shown_ == entries_ && history_.size() == kept_ + shown_) {
        return;
    }
    const std::lock_guard<std::mutex> lock(mutex_);
    history_.resize(kept_ + entries_);
    const Entry* entry = innermost_;
    for (size_t i = entries_; i > shown_; --i, entry = entry->outer) {
        history_[kept_ + i - 1] = entry->key;
    }
    shown_ = entries_;
}

// After a failure: keeps the history and drops the entries, whose keys may be destroyed.
void PStream::KeepPath() {
    ShowPath();
    kept_ = history_.size();
    innermost_ = nullptr;
    entries_ = shown_ = 0;
}

// Registers an entry while it is being transferred.
class PStream::EntryInTransfer {
public:
    EntryInTransfer(PStream& stream, std::string_view key) : stream_(stream), entry_{key} {
        stream.Enter(entry_);
    }
    ~EntryInTransfer() { stream_.Leave(entry_); }
    EntryInTransfer(const EntryInTransfer&) = delete;
    EntryInTransfer& operator=(const EntryInTransfer&) = delete;

private:
    PStream& stream_;
    Entry entry_;
};

// Sends or receives one whole value. Running out of memory is a failure like any other.
template <typename Step>
int PStream::Transfer(Step step) {
    int result = RESULT_IO;
    try {
        result = step();
        if (result < 0) {
            DumpHistory();
        }
    } catch (const std::bad_alloc&) {
        Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] ZEL/stream(%d): out of memory\n", __LINE__);
    }
    ClearHistory();
    return result;
}

int PStream::Send(Channel& channel, const PObject& value) {
    return Transfer([&] {
        const int result = SendObject(channel, value);
        if (result < 0) {
            return result;
        }
        return Passed(Slowly(channel).FlushWrite(0)) ? int{RESULT_SUCCESS} : int{RESULT_IO};
    });
}

int PStream::Recv(Channel& channel, PObject& value) {
    return Transfer([&] { return RecvObject(channel, value); });
}

int PStream::SendObject(Channel& channel, const PObject& value) {
    if (value.isNull()) {
        return SendNull(channel);
    }
    if (value.isInteger()) {
        return Send(channel, value.get<unsigned long long>());
    }
    if (value.isString()) {
        return Send(channel, value.get<std::string>());
    }
    if (value.isContainer()) {
        return SendContainer(channel, PObjectCursor::Of(value));
    }
    return RESULT_INTERRUPTED;
}

int PStream::RecvObject(Channel& channel, PObject& value) {
    unsigned char tag = 0;
    const int result = RecvTag(channel, tag);
    return result < 0 ? result : RecvDispatch(channel, tag, value);
}

int PStream::SendNull(Channel& channel) {
    UpdateStatus(0, 0);
    return WriteByte(channel, TAG_NULL) && WriteByte(channel, 0) ? RESULT_SUCCESS : RESULT_IO;
}

int PStream::Send(Channel& channel, unsigned long long value) {
    UpdateStatus(0, 0);
    const unsigned char length = IntegerLength(value);
    char element[2 + sizeof value] = {TAG_INTEGER, static_cast<char>(length)};
    const unsigned long long wire = __builtin_bswap64(value << (64 - 8 * length));
    memcpy(element + 2, &wire, sizeof wire);
    if (!channel.Store(element, size_t{2} + length) &&
        (!Passed(Slowly(channel).WriteByte(TAG_INTEGER)) || !Passed(channel.WriteByte(length)) ||
         !Passed(channel.Write(element + 2, length)))) {
        return RESULT_IO;
    }
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/stream(%d): %s%llu\n", __LINE__, Indent(),
                   value);
    return RESULT_SUCCESS;
}

int PStream::Send(Channel& channel, const std::string& value) {
    return SendText(channel, value.c_str(), value.size());
}

// REQUIRES text[size] == 0.
int PStream::SendText(Channel& channel, const char* text, size_t size) {
    UpdateStatus(0, 0);
    // Only the low 16 bits of the length are sent: the caller must keep strings short enough.
    const auto length = static_cast<unsigned short>(size);
    const char head[] = {TAG_STRING, static_cast<char>(length >> 8), static_cast<char>(length)};
    if (!channel.Store(head, sizeof head) &&
        (!Passed(Slowly(channel).WriteByte(TAG_STRING)) || !Passed(channel.WriteInt16(length)))) {
        return RESULT_IO;
    }
    // Cut to the largest length that the channel's parameter can hold: it refuses such a block
    // anyway.
    if (!channel.Store(text, size) &&
        !Passed(Slowly(channel).Write(
            text, static_cast<unsigned int>(std::min<size_t>(size, UINT32_MAX))))) {
        return RESULT_IO;
    }
    TraceText(text);
    return RESULT_SUCCESS;
}

int PStream::Send(Channel& channel, const std::map<std::string, PObject>& value) {
    return SendContainer(channel, PObjectCursor(value));
}

int PStream::Send(Channel& channel, const std::vector<PObject>& value) {
    return SendContainer(channel, PObjectCursor(value));
}

int PStream::Recv(Channel& channel, unsigned long long& value) {
    UpdateStatus(0, 0);
    if (Take(channel, value)) {
        return RESULT_SUCCESS;
    }
    unsigned char length = 0;
    char bytes[UINT8_MAX];
    if (!Passed(Slowly(channel).ReadByte(&length)) || !Passed(channel.Read(bytes, length))) {
        return RESULT_IO;
    }
    value = Fold(bytes, length);
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/stream(%d): %s%llu\n", __LINE__, Indent(),
                   value);
    return RESULT_SUCCESS;
}

int PStream::Recv(Channel& channel, std::string& value) {
    UpdateStatus(0, 0);
    if (Take(channel, value)) {
        return RESULT_SUCCESS;
    }
    unsigned short length = 0;
    bool passed = Passed(Slowly(channel).ReadInt16(&length));
    value.clear();
    value.reserve(length);
    while (passed && value.size() < length) {
        const size_t start = value.size();
        const size_t step = std::min(kStringStep, length - start);
        value.resize(start + step);
        passed = Passed(channel.Read(&value[start], static_cast<unsigned int>(step)));
    }
    value.resize(std::min(value.find('\0'), value.size()));
    if (!passed) {
        return RESULT_IO;
    }
    TraceText(value.c_str());
    return RESULT_SUCCESS;
}

int PStream::Recv(Channel& channel, std::map<std::string, PObject>& value) {
    int result = EnterBody("{");
    while (result == 0) {
        unsigned char tag = 0;
        result = RecvTag(channel, tag);
        if (result < 0) {
            break;
        }
        if (tag == TAG_END) {
            LeaveBody("}");
            break;
        }
        if (tag != TAG_STRING) {
            Logger::LogMsg(Logger::LEVEL_ERROR,
                           "[ERROR] ZEL/stream(%d): PStream: expect string, but get tag %u\n",
                           __LINE__, tag);
            return RESULT_PROTOCOL;
        }
        std::string key;
        result = Recv(channel, key);
        if (result < 0) {
            break;
        }
        if (!Afford(kEntryMemory, kKeyBytes + key.size())) {
            return RESULT_PROTOCOL;
        }
        // Senders send keys in order, so a new one usually belongs at the end.
        const auto entry = value.emplace_hint(value.end(), std::move(key), PObject());
        const EntryInTransfer in_transfer(*this, entry->first);
        result = RecvObject(channel, entry->second);
        if (result < 0) {
            KeepPath();
        }
    }
    return result;
}

int PStream::Recv(Channel& channel, std::vector<PObject>& value) {
    int result = EnterBody("[");
    while (result == 0) {
        unsigned char tag = 0;
        result = RecvTag(channel, tag);
        if (result < 0) {
            break;
        }
        if (tag == TAG_END) {
            LeaveBody("]");
            break;
        }
        if (!Afford(kElementMemory + (value.empty() ? kArrayMemory : 0), 0)) {
            return RESULT_PROTOCOL;
        }
        if (value.empty()) {
            value.reserve(kUsualLength);
        }
        PObject element;
        result = RecvDispatch(channel, tag, element);
        if (result == 0) {
            value.push_back(std::move(element));
        }
    }
    return result;
}

int PStream::RecvTag(Channel& channel, unsigned char& tag) {
    return ReadByte(channel, tag) ? RESULT_SUCCESS : RESULT_IO;
}

int PStream::RecvDispatch(Channel& channel, unsigned char tag, PObject& value) {
    switch (tag) {
        case TAG_STRING: {
            const int result = RecvInto<std::string>(channel, value);
            // A text takes about as much memory as it has bytes on the wire.
            return result < 0 || Afford(0, value.get<std::string>().size()) ? result
                                                                            : RESULT_PROTOCOL;
        }
        case TAG_INTEGER:
            return RecvInto<unsigned long long>(channel, value);
        case TAG_MAP:
            return RecvInto<PObject::Map>(channel, value);
        case TAG_ARRAY:
            return RecvInto<PObject::Array>(channel, value);
        case TAG_NULL:
            break;
        default:
            return Skip(channel, tag);
    }
    unsigned char length = 0;
    if (!ReadByte(channel, length)) {
        return RESULT_IO;
    }
    if (length != 0) {
        Logger::LogMsg(Logger::LEVEL_ERROR,
                       "[ERROR] ZEL/stream(%d): expect length 0, but we've got %u\n", __LINE__,
                       length);
        return RESULT_PROTOCOL;
    }
    value.clear();
    return RESULT_SUCCESS;
}

template <typename T>
int PStream::RecvInto(Channel& channel, PObject& value) {
    if (depth_ > 0 && !Afford(kHeapMemory<T>, kWireBytes<T>)) {
        return RESULT_PROTOCOL;
    }
    return Recv(channel, value.become<T>());
}

int PStream::Skip(Channel&, unsigned char) {
    return RESULT_PROTOCOL;
}

void PStream::UpdateStatus(unsigned long long done, unsigned long long total) {
    // Called for every scalar. Only the transferring thread writes the counters, so it may read
    // them without the lock.
    if (status_done_ == done && status_total_ == total) {
        return;
    }
    const std::lock_guard<std::mutex> lock(mutex_);
    status_done_ = done;
    status_total_ = total;
}

void PStream::GetStatus(std::string& path, unsigned long long& done, unsigned long long& total) {
    const std::lock_guard<std::mutex> lock(mutex_);
    path = GetHistory();
    done = status_done_;
    total = status_total_;
}

std::string PStream::GetHistory() {
    std::string path;
    for (const std::string& key : history_) {
        path += &key == &history_.front() ? "" : ".";
        path += key;
    }
    return path;
}

void PStream::DumpHistory() {
    const std::lock_guard<std::mutex> lock(mutex_);
    Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] ZEL/stream(%d): Error stack: %s\n", __LINE__,
                   GetHistory().c_str());
}

void PStream::ClearHistory() {
    // Only the transferring thread writes what the lock protects, so it may read without it.
    if (!history_.empty() || status_total_ != 0 || status_done_ != 0) {
        const std::lock_guard<std::mutex> lock(mutex_);
        history_.clear();
        status_total_ = 0;
        status_done_ = 0;
    }
    innermost_ = nullptr;
    entries_ = shown_ = kept_ = 0;
    depth_ = 0;
}

void PStream::GetVersion(unsigned int& major, unsigned int& minor, unsigned int& third) {
    major = 1;
    minor = 0;
    third = 0;
}

const char* PStream::Indent() const {
    return kIndent + 2 * (kIndentLevels - std::min<size_t>(depth_, kIndentLevels));
}

void PStream::TraceText(const char* text) const {
    if (!Logger::Passes(Logger::LEVEL_DEBUG)) {
        return;
    }
    for (const Entry* entry = innermost_; entry != nullptr; entry = entry->outer) {
        if (entry->key == kPasswordKey) {
            return;
        }
    }
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/stream(%d): %s\"%s\"\n", __LINE__, Indent(),
                   text);
}

// Iterative, with an explicit stack: a value may be nested too deeply for recursion.
int PStream::SendContainer(Channel& channel, const PObjectCursor& outermost) {
    struct Level {
        explicit Level(const PObjectCursor& container) : place(container) {}
        PObjectCursor place;
        std::optional<EntryInTransfer> entry;
    };
    SteadyStack<Level, kUsualDepth> open;
    int result = OpenContainer(channel, outermost);
    if (result == 0) {
        open.Push(outermost);
    }
    while (result == 0 && !open.IsEmpty()) {
        Level& level = open.Top();
        level.entry.reset();
        if (level.place.AtEnd()) {
            result = CloseContainer(channel, level.place);
            open.Pop();
            continue;
        }
        if (level.place.InMap()) {
            const std::string& key = level.place.Key();
            const size_t hidden = !key.empty() && key.front() == '_' ? 1 : 0;
            result = SendText(channel, key.c_str() + hidden, key.size() - hidden);
            if (result < 0) {
                break;
            }
            level.entry.emplace(*this, std::string_view(key).substr(hidden));
        }
        const PObject& value = level.place.Take();
        if (!value.isContainer()) {
            result = SendObject(channel, value);
        } else {
            const PObjectCursor container = PObjectCursor::Of(value);
            result = OpenContainer(channel, container);
            if (result == 0) {
                open.Push(container);
            }
        }
    }
    if (result < 0) {
        KeepPath();
    }
    return result;
}

int PStream::OpenContainer(Channel& channel, const PObjectCursor& container) {
    if (!WriteByte(channel, container.InMap() ? TAG_MAP : TAG_ARRAY)) {
        return RESULT_IO;
    }
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/stream(%d): %s%s\n", __LINE__, Indent(),
                   container.InMap() ? "{" : "[");
    ++depth_;
    return RESULT_SUCCESS;
}

int PStream::CloseContainer(Channel& channel, const PObjectCursor& container) {
    if (!WriteByte(channel, TAG_END)) {
        return RESULT_IO;
    }
    --depth_;
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/stream(%d): %s%s\n", __LINE__, Indent(),
                   container.InMap() ? "}" : "]");
    return RESULT_SUCCESS;
}

int PStream::EnterBody(const char* bracket) {
    if (depth_ >= kMaxDepth) {
        Logger::LogMsg(Logger::LEVEL_ERROR,
                       "[ERROR] ZEL/stream(%d): PStream: nested deeper than %u levels\n", __LINE__,
                       kMaxDepth);
        return RESULT_PROTOCOL;
    }
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/stream(%d): %s%s\n", __LINE__, Indent(),
                   bracket);
    if (depth_ == 0) {
        memory_left_ = kFreeMemory;
    }
    ++depth_;
    return RESULT_SUCCESS;
}

// Accounts for `memory` that the value takes and for `bytes` that were received for it. False when
// the budget is exceeded.
bool PStream::Afford(int64_t memory, size_t bytes) {
    const int64_t left = memory_left_ + kMemoryPerByte * static_cast<int64_t>(bytes) - memory;
    memory_left_ = static_cast<int32_t>(std::min<int64_t>(left, INT32_MAX));
    if (memory_left_ < 0) {
        Logger::LogMsg(
            Logger::LEVEL_ERROR,
            "[ERROR] ZEL/stream(%d): PStream: takes more memory than %d MiB and %d times "
            "its bytes\n",
            __LINE__, static_cast<int>(kFreeMemory >> 20), static_cast<int>(kMemoryPerByte));
        return false;
    }
    return true;
}

void PStream::LeaveBody(const char* bracket) {
    --depth_;
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/stream(%d): %s%s\n", __LINE__, Indent(),
                   bracket);
}

}  // namespace ZEL
