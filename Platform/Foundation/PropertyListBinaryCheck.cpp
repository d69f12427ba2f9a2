// The binary half of PropertyListCheck.h: a walk of a binary document's
// object table.
#include <algorithm>
#include <cstdint>
#include <vector>

#include "Platform/Foundation/PropertyListCheck.h"

namespace platform::plist::detail {

namespace {

// The binary layout: an 8-byte header, objects, a table of object offsets
// and a 32-byte trailer that says where the table is and how wide its
// entries and the object references are. Numbers are big-endian.
constexpr size_t kBinaryTrailerSize = 32;
constexpr size_t kTrailerOffsetSizeAt = 6;
constexpr size_t kTrailerRefSizeAt = 7;
constexpr size_t kTrailerObjectCountAt = 8;
constexpr size_t kTrailerTopObjectAt = 16;
constexpr size_t kTrailerOffsetTableAt = 24;
constexpr uint8_t kMarkerInteger = 0x1;
constexpr uint8_t kMarkerASCIIString = 0x5;
constexpr uint8_t kMarkerUTF16String = 0x6;
constexpr uint8_t kMarkerArray = 0xA;
constexpr uint8_t kMarkerSet = 0xC;
constexpr uint8_t kMarkerDictionary = 0xD;
constexpr uint8_t kMarkerExtendedLength = 0xF;

class BinaryScanner {
 public:
  explicit BinaryScanner(std::string_view bytes)
      : b_(reinterpret_cast<const uint8_t*>(bytes.data())), size_(bytes.size()) {}

  std::optional<std::string> run() {
    if (size_ < kBinaryTrailerSize) return std::nullopt;
    end_ = size_ - kBinaryTrailerSize;
    const uint8_t* trailer = b_ + end_;
    offsetSize_ = trailer[kTrailerOffsetSizeAt];
    refSize_ = trailer[kTrailerRefSizeAt];
    objectCount_ = bigEndian(trailer + kTrailerObjectCountAt, sizeof(uint64_t));
    offsetTable_ = bigEndian(trailer + kTrailerOffsetTableAt, sizeof(uint64_t));
    if (offsetSize_ < 1 || offsetSize_ > 8 || refSize_ < 1 || refSize_ > 8 || offsetTable_ >= end_ ||
        objectCount_ > (end_ - offsetTable_) / offsetSize_) {
      return std::nullopt;
    }
    for (uint64_t i = 0; i < objectCount_; ++i) {
      if (stringHasNUL(i)) return std::string("a string holds a NUL character");
    }
    return checkShape(bigEndian(trailer + kTrailerTopObjectAt, sizeof(uint64_t)));
  }

 private:
  static uint64_t bigEndian(const uint8_t* p, size_t width) {
    uint64_t v = 0;
    for (size_t i = 0; i < width; ++i) v = (v << 8) | p[i];
    return v;
  }

  std::optional<uint64_t> offsetOf(uint64_t index) const {
    if (index >= objectCount_) return std::nullopt;
    uint64_t offset = bigEndian(b_ + offsetTable_ + index * offsetSize_, offsetSize_);
    if (offset >= end_) return std::nullopt;
    return offset;
  }

  // The element count of the object at `offset` and where its contents
  // start: the marker's low nibble, or an integer object after it.
  bool readCount(uint64_t offset, uint64_t* count, uint64_t* contents) const {
    uint8_t info = b_[offset] & 0xF;
    *contents = offset + 1;
    *count = info;
    if (info != kMarkerExtendedLength) return true;
    if (*contents >= end_ || (b_[*contents] >> 4) != kMarkerInteger) return false;
    uint64_t width = uint64_t{1} << (b_[*contents] & 0xF);
    if (width > sizeof(uint64_t) || *contents + 1 + width > end_) return false;
    *count = bigEndian(b_ + *contents + 1, width);
    *contents += 1 + width;
    return true;
  }

  bool stringHasNUL(uint64_t index) const {
    std::optional<uint64_t> offset = offsetOf(index);
    if (!offset) return false;
    uint8_t type = b_[*offset] >> 4;
    uint64_t count = 0, start = 0;
    if ((type != kMarkerASCIIString && type != kMarkerUTF16String) || !readCount(*offset, &count, &start)) {
      return false;
    }
    uint64_t unit = type == kMarkerUTF16String ? 2 : 1;
    if (count > (end_ - start) / unit) return false;
    for (uint64_t i = 0; i < count; ++i) {
      const uint8_t* c = b_ + start + i * unit;
      if (c[0] == 0 && (unit == 1 || c[1] == 0)) return true;
    }
    return false;
  }

  // The references of a container object: where they start and how many
  // there are (a dictionary has its keys' and then its values'). False for
  // any other object.
  bool references(uint64_t index, uint64_t* start, uint64_t* count) const {
    std::optional<uint64_t> offset = offsetOf(index);
    if (!offset) return false;
    uint8_t type = b_[*offset] >> 4;
    if ((type != kMarkerArray && type != kMarkerSet && type != kMarkerDictionary) ||
        !readCount(*offset, count, start)) {
      return false;
    }
    if (type == kMarkerDictionary) *count *= 2;
    return *start <= end_ && *count <= (end_ - *start) / refSize_;
  }

  uint64_t reference(uint64_t start, uint64_t k) const { return bigEndian(b_ + start + k * refSize_, refSize_); }

  // libplist reads a shared object once for every reference to it and
  // recurses once per level, so a small document can describe an
  // exponentially large tree or overflow the stack. Walks the object graph
  // from the top object without recursion, with each object's depth and
  // expanded size computed once.
  std::optional<std::string> checkShape(uint64_t top) const {
    if (top >= objectCount_) return std::nullopt;
    enum : uint8_t { kUnvisited, kOnPath, kDone };
    std::vector<uint8_t> state(objectCount_, kUnvisited);
    std::vector<uint32_t> depth(objectCount_, 1);
    std::vector<uint64_t> size(objectCount_, 1);
    struct Frame {
      uint64_t index;
      uint64_t next = 0;
    };
    std::vector<Frame> path{{top}};
    state[top] = kOnPath;
    while (!path.empty()) {
      Frame& frame = path.back();
      uint64_t start = 0, count = 0;
      const bool container = references(frame.index, &start, &count);
      if (container && frame.next < count) {
        uint64_t child = reference(start, frame.next++);
        if (child >= objectCount_ || state[child] == kDone) continue;
        if (state[child] == kOnPath) return std::string("a container that contains itself");
        if (path.size() > static_cast<size_t>(kMaxNestingDepth)) return deeperThanLimit();
        state[child] = kOnPath;
        path.push_back({child});
        continue;
      }
      for (uint64_t k = 0; container && k < count; ++k) {
        uint64_t child = reference(start, k);
        if (child >= objectCount_) continue;
        depth[frame.index] = std::max(depth[frame.index], depth[child] + 1);
        size[frame.index] = std::min(kMaxExpandedObjects + 1, size[frame.index] + size[child]);
      }
      if (depth[frame.index] > static_cast<uint32_t>(kMaxNestingDepth) + 1) return deeperThanLimit();
      if (size[frame.index] > kMaxExpandedObjects) {
        return "shared objects that expand to more than " + std::to_string(kMaxExpandedObjects) + " values";
      }
      state[frame.index] = kDone;
      path.pop_back();
    }
    return std::nullopt;
  }

  static std::string deeperThanLimit() {
    return "nesting deeper than " + std::to_string(kMaxNestingDepth) + " levels";
  }

  const uint8_t* b_;
  size_t size_;
  uint64_t end_ = 0;
  uint64_t offsetSize_ = 0;
  uint64_t refSize_ = 0;
  uint64_t objectCount_ = 0;
  uint64_t offsetTable_ = 0;
};

}  // namespace

std::optional<std::string> checkBinaryPropertyList(std::string_view bytes) { return BinaryScanner(bytes).run(); }

}  // namespace platform::plist::detail
