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

constexpr size_t kIndentLevels = 11;  // deeper levels of the trace are not indented further
constexpr char kIndent[] = "                      ";
static_assert(sizeof kIndent - 1 == 2 * kIndentLevels);

// A received string grows by so many bytes at a time, so that a length costs memory only as its
// bytes arrive.
constexpr size_t kStringStep = 4096;

// Many arrays are no longer.
constexpr size_t kUsualLength = 4;

// Most messages are no deeper.
constexpr size_t kUsualDepth = 8;

// A stack whose first elements need no memory of their own, and none of which ever moves.
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

// Whether a step of the channel went well; a failure is told here.
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

// The low 64 bits of a number on the wire.
unsigned long long Fold(const char* bytes, unsigned int length) {
    unsigned long long value = 0;
    for (unsigned int i = 0; i < length; ++i) {
        value = value << 8 | static_cast<unsigned char>(bytes[i]);
    }
    return value;
}

}  // namespace

// A map's entry in transfer, in the frame of the call that transfers it.
struct PStream::Entry {
    std::string_view key;
    Entry* outer = nullptr;
};

// Steps that may wait, or fail, are the channel's own operations; all others are its shortcuts.
inline Channel& PStream::Slowly(Channel& channel) {
    ShowPath();
    return channel;
}

// The steps of one byte.

inline bool PStream::WriteByte(Channel& channel, unsigned char value) {
    return channel.Store(&value, sizeof value) || Passed(Slowly(channel).WriteByte(value));
}

inline bool PStream::ReadByte(Channel& channel, unsigned char& value) {
    return channel.Fetch(&value, sizeof value) || Passed(Slowly(channel).ReadByte(&value));
}

// The body of an integer or of a string, when all of it lies in the read ring.

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

// Makes the history what it should be.
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

// After a failure: the history stays as it is, and the entries, whose keys may go, are forgotten.
void PStream::KeepPath() {
    ShowPath();
    kept_ = history_.size();
    innermost_ = nullptr;
    entries_ = shown_ = 0;
}

// An entry for as long as it is in transfer.
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

// A whole value in one direction. A value may be larger than memory: that is a failure like any
// other.
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
    // The length is the low 16 bits whatever the string's length is: short strings are the caller's
    // business.
    const auto length = static_cast<unsigned short>(size);
    const char head[] = {TAG_STRING, static_cast<char>(length >> 8), static_cast<char>(length)};
    if (!channel.Store(head, sizeof head) &&
        (!Passed(Slowly(channel).WriteByte(TAG_STRING)) || !Passed(channel.WriteInt16(length)))) {
        return RESULT_IO;
    }
    // A larger string than a channel can be given is refused by the channel, as it would be in full
    // length.
    if (!channel.Store(text, size) &&
        !Passed(Slowly(channel).Write(
            text, static_cast<unsigned int>(std::min<size_t>(size, UINT32_MAX))))) {
        return RESULT_IO;
    }
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/stream(%d): %s\"%s\"\n", __LINE__, Indent(),
                   text);
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
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/stream(%d): %s\"%s\"\n", __LINE__, Indent(),
                   value.c_str());
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
        // Keys come in order, so the end is where a new one belongs.
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
        case TAG_STRING:
            return Recv(channel, value.become<std::string>());
        case TAG_INTEGER:
            return Recv(channel, value.become<unsigned long long>());
        case TAG_MAP:
            return Recv(channel, value.become<PObject::Map>());
        case TAG_ARRAY:
            return Recv(channel, value.become<PObject::Array>());
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

int PStream::Skip(Channel&, unsigned char) {
    return RESULT_PROTOCOL;
}

void PStream::UpdateStatus(unsigned long long done, unsigned long long total) {
    // Every scalar comes here. Only the thread that transfers writes the counters, so it may look
    // at them unlocked.
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
    // Only the thread that transfers writes what the lock is over, so it may look unlocked.
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

// A loop with a stack of its own: a sender's value may be nested deeper than the thread's stack
// allows.
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
    ++depth_;
    return RESULT_SUCCESS;
}

void PStream::LeaveBody(const char* bracket) {
    --depth_;
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/stream(%d): %s%s\n", __LINE__, Indent(),
                   bracket);
}

}  // namespace ZEL
