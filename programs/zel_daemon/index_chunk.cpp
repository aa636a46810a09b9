#include "programs/zel_daemon/index_chunk.h"

#include <algorithm>
#include <utility>

#include "programs/common/failure.h"

namespace zel_daemon {

namespace {

constexpr uint64_t kLinked = 1;
constexpr uint64_t kYoung = 2;
constexpr unsigned int kMarks = 2;
constexpr unsigned int kMostBits = 64;

[[noreturn]] void Damaged() {
    throw programs::Failure(programs::FailureKind::kLocal, "its content is damaged");
}

}  // namespace

// Seven bits a byte, the lowest first.
void ChunkWriter::Number(uint64_t value) {
    for (; value > 0x7f; value >>= 7) {
        bytes_ += static_cast<char>(value | 0x80);
    }
    bytes_ += static_cast<char>(value);
}

// Up or down, with the sign in the lowest bit.
void ChunkWriter::Difference(uint64_t value, uint64_t from) {
    const uint64_t up = value - from;
    const uint64_t down = from - value;
    Number(up < down || up == 0 ? up << 1 : (down << 1) - 1);
}

void ChunkWriter::Add(std::string_view key, const EntryFacts& facts) {
    const auto differs =
        std::mismatch(key.begin(), key.end(), last_.key.begin(), last_.key.end()).first;
    const auto shared = static_cast<size_t>(differs - key.begin());
    const EntryFacts& last = last_.facts;
    Number(last_.key.size() - shared);
    Number(key.size() - shared);
    bytes_.append(key.substr(shared));
    Number(uint64_t{facts.mode} << kMarks | (facts.linked ? kLinked : 0) |
           (facts.young ? kYoung : 0));
    Difference(facts.inode, last.inode);
    Number(facts.size);
    Difference(facts.modified, last.modified);
    Difference(facts.changed, facts.modified);
    last_.key = key;
    last_.facts = facts;
}

std::string ChunkWriter::Take() {
    last_ = {};
    return std::exchange(bytes_, {});
}

uint64_t ChunkReader::Number() {
    uint64_t value = 0;
    for (unsigned int bits = 0; bits < kMostBits && !bytes_.empty(); bits += 7) {
        const auto byte = static_cast<unsigned char>(bytes_.front());
        bytes_.remove_prefix(1);
        value |= uint64_t{byte & 0x7fU} << bits;
        if (byte <= 0x7f) {
            return value;
        }
    }
    Damaged();
}

uint64_t ChunkReader::Sum(uint64_t from) {
    const uint64_t number = Number();
    return (number & 1) == 0 ? from + (number >> 1) : from - (number >> 1) - 1;
}

bool ChunkReader::Next(IndexEntry& entry) {
    if (bytes_.empty()) {
        return false;
    }
    const uint64_t dropped = Number();
    const uint64_t added = Number();
    if (dropped > last_.key.size() || added > bytes_.size()) {
        Damaged();
    }
    last_.key.resize(last_.key.size() - static_cast<size_t>(dropped));
    last_.key.append(bytes_.substr(0, static_cast<size_t>(added)));
    bytes_.remove_prefix(static_cast<size_t>(added));
    EntryFacts& facts = last_.facts;
    const uint64_t mode = Number();
    facts.mode = static_cast<uint32_t>(mode >> kMarks);
    facts.linked = (mode & kLinked) != 0;
    facts.young = (mode & kYoung) != 0;
    facts.inode = Sum(facts.inode);
    facts.size = Number();
    facts.modified = Sum(facts.modified);
    facts.changed = Sum(facts.modified);
    entry = last_;
    return true;
}

}  // namespace zel_daemon
