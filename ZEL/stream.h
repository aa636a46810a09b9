// The wire encoding of PObjects.
//
// docs/wire-format.md describes the bytes.
#pragma once

#include <cstdint>
#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "ZEL/channel.h"
#include "ZEL/pobject.h"

namespace ZEL {

class PObjectCursor;

#pragma GCC visibility push(default)

/// Sends and receives PObjects over a Channel that each call is given. It keeps no connection, only
/// the path of map keys that is being transferred and two progress counters.
///
/// Results: 0 on success; -2: the channel failed; -5: the peer sent bytes that are not a value; -1:
/// a value of unknown type. After a failure the connection is in the middle of a value: close it.
///
/// A value of any depth can be sent; one nested deeper than kMaxDepth is not received (-5), nor one
/// that would take more memory than kFreeMemory and kMemoryPerByte allow (-5).
///
/// At debug level each value is traced in the log, but for texts under the key "pswd".
///
/// Threads: one thread sends or receives; any other may call GetStatus() meanwhile.
class PStream {
public:
    /// The deepest nesting of maps and arrays that is received: the outermost one is level 1.
    /// Receiving calls itself once a level: this bounds the stack that a peer can make it use.
    static constexpr uint32_t kMaxDepth = 512;

    /// What a received value may take in memory: this much, and so many bytes for each byte that
    /// has arrived. Two bytes can be an empty map, which takes forty times as much: a peer must not
    /// be able to make the receiver hold many times what it sends.
    static constexpr int64_t kFreeMemory = int64_t{32} << 20;
    static constexpr int64_t kMemoryPerByte = 8;

    /// The first byte of each element on the wire.
    enum Tag : unsigned char {
        TAG_NULL = 0x00,
        TAG_INTEGER = 0x01,
        TAG_STRING = 0x10,
        TAG_END = 0x40,    ///< of a map or an array
        TAG_ARRAY = 0x41,  ///< 'A'
        TAG_MAP = 0x42     ///< 'B'
    };

    /// The type number and the tag of the values that a T holds: std::string, unsigned long long,
    /// PObject::Map or PObject::Array.
    template <typename T>
    static constexpr int32_t GetType() {
        return PObject::type_trait<T>::type;
    }
    template <typename T>
    static constexpr unsigned char GetTag();

    PStream() = default;
    PStream(const PStream&) = delete;
    PStream& operator=(const PStream&) = delete;

    /// Sends a whole value and flushes the channel. A failure's key path goes to the log.
    int Send(Channel& channel, const PObject& value);
    /// Receives a whole value. An object of the received type keeps what it holds: a map takes the
    /// new entries in, an array appends. After a failure the object is filled in part.
    int Recv(Channel& channel, PObject& value);

    /// As Send() and Recv(), but nothing is flushed, and after a failure GetHistory() still tells
    /// where it was.
    int SendObject(Channel& channel, const PObject& value);
    int RecvObject(Channel& channel, PObject& value);

    /// Write one element, its tag included. Nothing is flushed. A string of 65536 bytes or more
    /// breaks the stream (its length has 16 bits): the caller keeps strings, keys included,
    /// shorter.
    int SendNull(Channel& channel);
    int Send(Channel& channel, unsigned long long value);
    int Send(Channel& channel, const std::string& value);
    int Send(Channel& channel, const std::map<std::string, PObject>& value);
    int Send(Channel& channel, const std::vector<PObject>& value);

    /// Read the body of one element, whose tag the caller has read. An integer of more than 8 bytes
    /// keeps its low 64 bits; a string ends at its first zero byte.
    int Recv(Channel& channel, unsigned long long& value);
    int Recv(Channel& channel, std::string& value);
    int Recv(Channel& channel, std::map<std::string, PObject>& value);
    int Recv(Channel& channel, std::vector<PObject>& value);

    int RecvTag(Channel& channel, unsigned char& tag);
    /// Receives the body of an element with that tag.
    int RecvDispatch(Channel& channel, unsigned char tag, PObject& value);
    /// Handles an unknown tag: always -5; it is never skipped.
    int Skip(Channel& channel, unsigned char tag);

    /// Sets the counters that GetStatus() gives; only on the thread that transfers. The start of
    /// each scalar sets both to 0.
    void UpdateStatus(unsigned long long done, unsigned long long total);
    /// The key path that is being transferred, and the counters. Any thread may call.
    void GetStatus(std::string& path, unsigned long long& done, unsigned long long& total);
    /// The keys from the outermost map inwards, joined with ".". Only on the thread that transfers,
    /// or see GetStatus().
    std::string GetHistory();
    /// Writes the key path to the log, at error level.
    void DumpHistory();
    /// Clears key path, counters and depth.
    void ClearHistory();

    /// A folder for received files, stored for callers; the library does not use it.
    void SetDefaultRecvLocation(const std::string& location) { default_recv_location_ = location; }
    /// The protocol's version: 1, 0, 0.
    void GetVersion(unsigned int& major, unsigned int& minor, unsigned int& third);

private:
    struct Entry;
    class EntryInTransfer;

    template <typename Step>
    int Transfer(Step step);
    bool WriteByte(Channel& channel, unsigned char value);
    bool ReadByte(Channel& channel, unsigned char& value);
    static bool Take(Channel& channel, unsigned long long& value);
    static bool Take(Channel& channel, std::string& value);
    Channel& Slowly(Channel& channel);
    void Enter(Entry& entry);
    void Leave(const Entry& entry);
    void ShowPath();
    void KeepPath();
    int SendText(Channel& channel, const char* text, size_t size);
    const char* Indent() const;
    void TraceText(const char* text) const;
    int OpenContainer(Channel& channel, const PObjectCursor& container);
    int CloseContainer(Channel& channel, const PObjectCursor& container);
    int SendContainer(Channel& channel, const PObjectCursor& outermost);
    int EnterBody(const char* bracket);
    bool Afford(int64_t memory, size_t bytes);
    template <typename T>
    int RecvInto(Channel& channel, PObject& value);
    void LeaveBody(const char* bracket);

    // Keys from the outermost map to the entry in transfer. Brought up to date only before steps
    // that may wait or fail, and at the end. Most entries are copied between ring and value without
    // such a step, and no other thread can see a difference.
    std::vector<std::string> history_;
    unsigned long long status_total_ = 0;
    unsigned long long status_done_ = 0;
    std::mutex mutex_;         // over the three above
    uint32_t depth_ = 0;       // maps and arrays that are open
    int32_t memory_left_ = 0;  // bytes that the value being received may still take
    std::string default_recv_location_;
    Entry* innermost_ = nullptr;  // the entry in transfer, which leads to those around it
    size_t entries_ = 0;          // how many they are
    size_t shown_ = 0;            // how many of them, from the outermost on, stand in the history
    size_t kept_ = 0;             // keys in front of them there: where an earlier transfer failed
};

template <>
constexpr unsigned char PStream::GetTag<std::string>() {
    return TAG_STRING;
}
template <>
constexpr unsigned char PStream::GetTag<unsigned long long>() {
    return TAG_INTEGER;
}
template <>
constexpr unsigned char PStream::GetTag<PObject::Map>() {
    return TAG_MAP;
}
template <>
constexpr unsigned char PStream::GetTag<PObject::Array>() {
    return TAG_ARRAY;
}

#pragma GCC visibility pop

}  // namespace ZEL
