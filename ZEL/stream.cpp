#include "ZEL/stream.h"

#include <algorithm>
#include <new>
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

// A larger string than a channel can be given is refused by the channel, as it would be in full
// length.
unsigned int BlockLength(size_t size) {
    return static_cast<unsigned int>(std::min<size_t>(size, UINT32_MAX));
}

}  // namespace

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
        return Passed(channel.FlushWrite(0)) ? int{RESULT_SUCCESS} : int{RESULT_IO};
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
    return Passed(channel.WriteByte(TAG_NULL)) && Passed(channel.WriteByte(0)) ? RESULT_SUCCESS
                                                                               : RESULT_IO;
}

int PStream::Send(Channel& channel, unsigned long long value) {
    UpdateStatus(0, 0);
    const unsigned char length = IntegerLength(value);
    char bytes[8];
    for (unsigned int i = 0; i < length; ++i) {
        bytes[i] = static_cast<char>(value >> (8 * (length - 1U - i)));
    }
    if (!Passed(channel.WriteByte(TAG_INTEGER)) || !Passed(channel.WriteByte(length)) ||
        !Passed(channel.Write(bytes, length))) {
        return RESULT_IO;
    }
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/stream(%d): %s%llu\n", __LINE__, Indent(),
                   value);
    return RESULT_SUCCESS;
}

int PStream::Send(Channel& channel, const std::string& value) {
    UpdateStatus(0, 0);
    // The length is the low 16 bits whatever the string's length is: short strings are the caller's
    // business.
    if (!Passed(channel.WriteByte(TAG_STRING)) ||
        !Passed(channel.WriteInt16(static_cast<unsigned short>(value.size()))) ||
        !Passed(channel.Write(value.data(), BlockLength(value.size())))) {
        return RESULT_IO;
    }
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/stream(%d): %s\"%s\"\n", __LINE__, Indent(),
                   value.c_str());
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
    unsigned char length = 0;
    unsigned char bytes[UINT8_MAX];
    if (!Passed(channel.ReadByte(&length)) ||
        !Passed(channel.Read(reinterpret_cast<char*>(bytes), length))) {
        return RESULT_IO;
    }
    value = 0;
    for (unsigned int i = 0; i < length; ++i) {
        value = value << 8 | bytes[i];
    }
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/stream(%d): %s%llu\n", __LINE__, Indent(),
                   value);
    return RESULT_SUCCESS;
}

int PStream::Recv(Channel& channel, std::string& value) {
    UpdateStatus(0, 0);
    unsigned short length = 0;
    bool passed = Passed(channel.ReadInt16(&length));
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
    std::string key;
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
        result = Recv(channel, key);
        if (result < 0) {
            break;
        }
        // Keys come in order, so the end is where a new one belongs.
        PObject& entry = value.try_emplace(value.end(), key)->second;
        PushKey(key);
        result = RecvObject(channel, entry);
        if (result == 0) {
            PopKey(key);
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
        PObject element;
        result = RecvDispatch(channel, tag, element);
        if (result == 0) {
            value.push_back(std::move(element));
        }
    }
    return result;
}

int PStream::RecvTag(Channel& channel, unsigned char& tag) {
    return Passed(channel.ReadByte(&tag)) ? RESULT_SUCCESS : RESULT_IO;
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
    if (!Passed(channel.ReadByte(&length))) {
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
    {
        const std::lock_guard<std::mutex> lock(mutex_);
        history_.clear();
        status_total_ = 0;
        status_done_ = 0;
    }
    depth_ = 0;
}

void PStream::GetVersion(unsigned int& major, unsigned int& minor, unsigned int& third) {
    major = 1;
    minor = 0;
    third = 0;
}

// The key's memory goes to the history and comes back with PopKey(), so that a map's entries share
// one string.
void PStream::PushKey(std::string& key) {
    const std::lock_guard<std::mutex> lock(mutex_);
    history_.push_back(std::move(key));
}

void PStream::PopKey(std::string& key) {
    const std::lock_guard<std::mutex> lock(mutex_);
    key = std::move(history_.back());
    history_.pop_back();
}

const char* PStream::Indent() const {
    return kIndent + 2 * (kIndentLevels - std::min<size_t>(depth_, kIndentLevels));
}

// A loop with a stack of its own: a sender's value may be nested deeper than the thread's stack
// allows.
int PStream::SendContainer(Channel& channel, const PObjectCursor& outermost) {
    std::vector<PObjectCursor> open;
    std::string key;
    int result = OpenContainer(channel, outermost, open);
    while (result == 0 && !open.empty()) {
        PObjectCursor& place = open.back();
        bool value_sent = true;
        if (place.AtEnd()) {
            result = CloseContainer(channel, place);
            open.pop_back();
        } else {
            if (place.InMap()) {
                const std::string& name = place.Key();
                key.assign(name, !name.empty() && name[0] == '_' ? 1 : 0, std::string::npos);
                result = Send(channel, key);
                if (result < 0) {
                    break;
                }
                PushKey(key);
            }
            const PObject& value = place.Take();
            value_sent = !value.isContainer();
            result = value_sent ? SendObject(channel, value)
                                : OpenContainer(channel, PObjectCursor::Of(value), open);
        }
        if (result == 0 && value_sent && !open.empty() && open.back().InMap()) {
            PopKey(key);
        }
    }
    return result;
}

int PStream::OpenContainer(Channel& channel, const PObjectCursor& container,
                           std::vector<PObjectCursor>& open) {
    if (!Passed(channel.WriteByte(container.InMap() ? TAG_MAP : TAG_ARRAY))) {
        return RESULT_IO;
    }
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/stream(%d): %s%s\n", __LINE__, Indent(),
                   container.InMap() ? "{" : "[");
    ++depth_;
    open.push_back(container);
    return RESULT_SUCCESS;
}

int PStream::CloseContainer(Channel& channel, const PObjectCursor& container) {
    if (!Passed(channel.WriteByte(TAG_END))) {
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
