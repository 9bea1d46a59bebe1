// Writes values as binary property lists ("bplist00"). Short strings, keys
// included, are stored once per document and referenced from every place
// they occur. A writer keeps its working buffers between documents, so one
// writer serving many small documents (the records of a changelog) allocates
// almost nothing after the first.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "VantorSyncManager/Value.h"

namespace vtc::plist {

class BinaryPlistWriter {
 public:
  // Appends the document of value to out. A none value has no property-list
  // form and appends nothing; none values inside containers are left out.
  // Values nested deeper than readers accept (kMaxDepth) raise
  // std::invalid_argument, and out is then unchanged.
  void append(const Value& value, Bytes& out);
  // The same for an array, without wrapping (and copying) it into a Value.
  void append(const Array& array, Bytes& out);

 private:
  enum class Shape : uint8_t { Scalar, String, Array, Dictionary };
  struct Object {
    Shape shape;
    const void* source;  // the Value, std::string, Array or Dictionary
    uint32_t refs;       // containers: where their references start in refs_
    uint32_t count;      // containers: entries written
  };
  struct Slot {
    size_t hash;
    uint32_t id;
    uint32_t generation;
  };

  void begin();
  void finish(Bytes& out);
  uint32_t add(const Value& value, unsigned depth);
  uint32_t addString(const std::string& s);
  static void checkDepth(unsigned depth, size_t children);
  uint32_t addArray(const Array& array, unsigned depth);
  uint32_t addDictionary(const Dictionary& dictionary, unsigned depth);
  void growStringTable();
  void writeObject(const Object& object, Bytes& out);

  std::vector<Object> objects_;
  std::vector<uint32_t> refs_;
  std::vector<uint64_t> offsets_;
  std::vector<uint16_t> units_;  // a non-ASCII string as UTF-16
  std::vector<Slot> strings_;    // open addressing; slots of older documents count as empty
  uint32_t generation_ = 0;
  size_t stringCount_ = 0;
  size_t refWidth_ = 1;
};

}  // namespace vtc::plist
