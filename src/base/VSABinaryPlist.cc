#include "base/VSABinaryPlist.h"

#include <algorithm>
#include <bit>
#include <cstring>
#include <limits>
#include <new>
#include <stdexcept>

#include "base/VSAPathString.h"

namespace {

// ---- UTF-8 / UTF-16 -------------------------------------------------------

// Eight bytes at a time: paths and identifiers are long and almost always ASCII.
bool isASCII(const std::string& s) {
  const char* p = s.data();
  size_t n = s.size(), i = 0;
  for (; i + 8 <= n; i += 8) {
    uint64_t w;
    std::memcpy(&w, p + i, 8);
    if (w & 0x8080808080808080ull) return false;
  }
  for (; i < n; ++i)
    if (static_cast<unsigned char>(p[i]) >= 0x80) return false;
  return true;
}

bool utf8ToUTF16(const std::string& s, std::vector<uint16_t>& out) {
  size_t i = 0;
  while (i < s.size()) {
    unsigned char c = s[i];
    uint32_t cp;
    int extra;
    if (c < 0x80) {
      cp = c;
      extra = 0;
    } else if ((c & 0xE0) == 0xC0) {
      cp = c & 0x1F;
      extra = 1;
    } else if ((c & 0xF0) == 0xE0) {
      cp = c & 0x0F;
      extra = 2;
    } else if ((c & 0xF8) == 0xF0) {
      cp = c & 0x07;
      extra = 3;
    } else {
      return false;
    }
    for (int k = 1; k <= extra; ++k) {
      if (i + k >= s.size()) return false;
      unsigned char cc = s[i + k];
      if ((cc & 0xC0) != 0x80) return false;
      cp = (cp << 6) | (cc & 0x3F);
    }
    static const uint32_t minimum[] = {0, 0x80, 0x800, 0x10000};
    if (cp < minimum[extra] || cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF)) return false;
    if (cp >= 0x10000) {
      cp -= 0x10000;
      out.push_back(static_cast<uint16_t>(0xD800 + (cp >> 10)));
      out.push_back(static_cast<uint16_t>(0xDC00 + (cp & 0x3FF)));
    } else {
      out.push_back(static_cast<uint16_t>(cp));
    }
    i += extra + 1;
  }
  return true;
}

// ---- Encoder --------------------------------------------------------------

class Encoder {
 public:
  Encoder(VSABinaryPlist::UUIDForm form) : form_(form) {}

  std::optional<std::vector<uint8_t>> run(const VSAValue& root, std::string* error) {
    nodes_.reserve(64);  // a request or reply: a few dozen objects
    flatten(root);
    size_t count = nodes_.size();
    refSize_ = count <= 0xFF ? 1 : count <= 0xFFFF ? 2 : 4;
    // Grown once: markers, counts, references and offsets take at most this
    // much beside the payload (a UTF-16 string at most twice its bytes).
    out_.reserve(4 + 8 + 2 * payloadBytes_ + count * (18 + 2 * refSize_) + 32);
    out_ = {'b', 'p', 'l', 'i', 's', 't', '0', '0'};
    std::vector<uint64_t> offsets;
    offsets.reserve(count);
    for (const Node& node : nodes_) {
      offsets.push_back(out_.size());
      if (!writeNode(node, error)) return std::nullopt;
    }
    uint64_t tableOffset = out_.size();
    int offsetSize = bytesFor(tableOffset);
    for (uint64_t off : offsets) writeBE(off, offsetSize);
    uint8_t trailer[32] = {};
    trailer[6] = static_cast<uint8_t>(offsetSize);
    trailer[7] = static_cast<uint8_t>(refSize_);
    putBE(trailer + 8, count, 8);
    putBE(trailer + 16, 0, 8);
    putBE(trailer + 24, tableOffset, 8);
    out_.insert(out_.end(), trailer, trailer + 32);
    return std::move(out_);
  }

 private:
  struct Node {
    const VSAValue* value = nullptr;
    const std::string* key = nullptr;
    std::vector<uint64_t> children;
  };

  uint64_t flatten(const VSAValue& v) {
    uint64_t index = nodes_.size();
    nodes_.push_back(Node{&v, nullptr, {}});
    if (auto s = v.stringValue()) payloadBytes_ += s->size();
    if (auto d = v.dataValue()) payloadBytes_ += d->size();
    if (auto a = v.arrayValue()) {
      std::vector<uint64_t> kids;
      kids.reserve(a->size());
      for (const VSAValue& child : *a) kids.push_back(flatten(child));
      nodes_[index].children = std::move(kids);
    } else if (auto d = v.dictionaryValue()) {
      std::vector<uint64_t> keys, values;
      keys.reserve(2 * d->size());
      values.reserve(d->size());
      for (const auto& [k, _] : *d) {
        keys.push_back(nodes_.size());
        nodes_.push_back(Node{nullptr, &k, {}});
        payloadBytes_ += k.size();
      }
      for (const auto& [_, child] : *d) values.push_back(flatten(child));
      keys.insert(keys.end(), values.begin(), values.end());
      nodes_[index].children = std::move(keys);
    }
    return index;
  }

  static int bytesFor(uint64_t v) {
    return v <= 0xFF ? 1 : v <= 0xFFFF ? 2 : v <= 0xFFFFFFFFu ? 4 : 8;
  }

  static void putBE(uint8_t* p, uint64_t v, int size) {
    for (int i = size - 1; i >= 0; --i) {
      p[i] = static_cast<uint8_t>(v);
      v >>= 8;
    }
  }
  void writeBE(uint64_t v, int size) {
    if (size == 1) return out_.push_back(static_cast<uint8_t>(v));  // most references
    size_t at = out_.size();
    out_.resize(at + static_cast<size_t>(size));
    putBE(out_.data() + at, v, size);
  }
  void writeMarkerWithCount(uint8_t high, uint64_t count) {
    if (count < 15) {
      out_.push_back(static_cast<uint8_t>(high | count));
      return;
    }
    out_.push_back(static_cast<uint8_t>(high | 0x0F));
    writeUnsigned(count);
  }
  void writeUnsigned(uint64_t v) {
    if (v > static_cast<uint64_t>(std::numeric_limits<int64_t>::max())) {
      out_.push_back(0x14);
      writeBE(0, 8);
      writeBE(v, 8);
      return;
    }
    int size = bytesFor(v);
    out_.push_back(static_cast<uint8_t>(0x10 | std::countr_zero(static_cast<unsigned>(size))));
    writeBE(v, size);
  }
  void writeDouble(uint8_t marker, double d) {
    out_.push_back(marker);
    writeBE(std::bit_cast<uint64_t>(d), 8);
  }
  bool writeString(const std::string& s, std::string* error) {
    if (isASCII(s)) {
      writeMarkerWithCount(0x50, s.size());
      out_.insert(out_.end(), s.begin(), s.end());
      return true;
    }
    std::vector<uint16_t> units;
    if (!utf8ToUTF16(s, units)) {
      if (error) *error = "string is not valid UTF-8";
      return false;
    }
    writeMarkerWithCount(0x60, units.size());
    for (uint16_t u : units) writeBE(u, 2);
    return true;
  }
  void writeData(const uint8_t* p, size_t n) {
    writeMarkerWithCount(0x40, n);
    out_.insert(out_.end(), p, p + n);
  }

  bool writeNode(const Node& node, std::string* error) {
    if (node.key) return writeString(*node.key, error);
    const VSAValue& v = *node.value;
    switch (v.type()) {
      case VSAValue::Type::Null:
        out_.push_back(0x00);
        return true;
      case VSAValue::Type::Bool:
        out_.push_back(*v.boolValue() ? 0x09 : 0x08);
        return true;
      case VSAValue::Type::Int: {
        int64_t i = *v.int64Value();
        if (i < 0) {
          out_.push_back(0x13);
          writeBE(static_cast<uint64_t>(i), 8);
        } else {
          writeUnsigned(static_cast<uint64_t>(i));
        }
        return true;
      }
      case VSAValue::Type::UInt:
        writeUnsigned(*v.uint64Value());
        return true;
      case VSAValue::Type::Real:
        writeDouble(0x23, *v.doubleValue());
        return true;
      case VSAValue::Type::Date:
        writeDouble(0x33, v.dateValue()->secondsSinceReferenceDate);
        return true;
      case VSAValue::Type::String:
        return writeString(*v.stringValue(), error);
      case VSAValue::Type::Data:
        writeData(v.dataValue()->data(), v.dataValue()->size());
        return true;
      case VSAValue::Type::UUID: {
        VSAUUID u = *v.uuidValue();
        if (form_ == VSABinaryPlist::UUIDForm::String) return writeString(u.string(), error);
        writeData(u.bytes().data(), 16);
        return true;
      }
      case VSAValue::Type::Array:
        writeMarkerWithCount(0xA0, node.children.size());
        for (uint64_t c : node.children) writeBE(c, refSize_);
        return true;
      case VSAValue::Type::Dictionary:
        writeMarkerWithCount(0xD0, node.children.size() / 2);
        for (uint64_t c : node.children) writeBE(c, refSize_);
        return true;
    }
    return false;
  }

  VSABinaryPlist::UUIDForm form_;
  std::vector<Node> nodes_;
  std::vector<uint8_t> out_;
  int refSize_ = 1;
  size_t payloadBytes_ = 0;  // strings, keys and data
};

// ---- Decoder --------------------------------------------------------------

class Decoder {
 public:
  Decoder(const uint8_t* d, size_t n)
      : d_(d), n_(n), budget_(VSABinaryPlist::decodedSizeBudget(n)) {}

  std::optional<VSAValue> run(std::string* error) {
    if (!readTrailer()) return fail(error);
    visiting_.assign(numObjects_, 0);
    VSAValue out;
    if (!readObject(top_, 0, out)) return fail(error);
    return out;
  }

 private:
  std::optional<VSAValue> fail(std::string* error) {
    if (error) *error = why_.empty() ? "malformed binary property list" : why_;
    return std::nullopt;
  }
  bool bad(const char* why) {
    if (why_.empty()) why_ = why;
    return false;
  }

  // Charges `bytes` against the byte budget before they are allocated.
  bool charge(uint64_t bytes) {
    if (bytes > budget_ - spent_) return bad("decoded size exceeds the budget");
    spent_ += bytes;
    return true;
  }

  uint64_t readBE(size_t pos, int size) const {
    uint64_t v = 0;
    for (int i = 0; i < size; ++i) v = (v << 8) | d_[pos + i];
    return v;
  }

  bool readTrailer() {
    if (n_ < 8 + 32 + 1 || std::memcmp(d_, "bplist0", 7) != 0)
      return bad("not a binary property list");
    size_t t = n_ - 32;
    offsetSize_ = d_[t + 6];
    refSize_ = d_[t + 7];
    numObjects_ = readBE(t + 8, 8);
    top_ = readBE(t + 16, 8);
    tableOffset_ = readBE(t + 24, 8);
    auto validSize = [](int s) { return s == 1 || s == 2 || s == 4 || s == 8; };
    if (!validSize(offsetSize_) || !validSize(refSize_)) return bad("bad trailer sizes");
    if (numObjects_ == 0 || top_ >= numObjects_) return bad("bad object count");
    if (tableOffset_ < 8 || tableOffset_ > t) return bad("bad offset table position");
    if (numObjects_ > (t - tableOffset_) / offsetSize_)
      return bad("offset table overruns the file");
    return true;
  }

  bool offsetOf(uint64_t index, size_t& pos) {
    if (index >= numObjects_) return bad("object reference out of range");
    uint64_t off = readBE(tableOffset_ + index * offsetSize_, offsetSize_);
    if (off < 8 || off >= tableOffset_) return bad("object offset out of range");
    pos = off;
    return true;
  }

  // Reads the count of a marker whose low nibble may say "count follows".
  bool readCount(size_t& pos, uint8_t low, uint64_t& count) {
    if (low != 0x0F) {
      count = low;
      return true;
    }
    if (pos >= tableOffset_) return bad("truncated count");
    uint8_t m = d_[pos++];
    if ((m & 0xF0) != 0x10 || (m & 0x0F) > 3) return bad("bad count marker");
    int size = 1 << (m & 0x0F);
    if (pos + size > tableOffset_) return bad("truncated count");
    count = readBE(pos, size);
    pos += size;
    return true;
  }

  bool fits(size_t pos, uint64_t count, uint64_t unit) {
    if (unit && count > (tableOffset_ - pos) / unit) return bad("object overruns the object area");
    return true;
  }

  bool readObject(uint64_t index, int depth, VSAValue& out) {
    if (depth > VSABinaryPlist::kMaxDepth) return bad("nesting too deep");
    if (++decoded_ > VSABinaryPlist::kMaxDecodedValues) return bad("too many values");
    if (!charge(VSABinaryPlist::kValueCost)) return false;
    size_t pos;
    if (!offsetOf(index, pos)) return false;
    uint8_t marker = d_[pos++];
    uint8_t high = marker & 0xF0, low = marker & 0x0F;
    switch (high) {
      case 0x00:
        if (marker == 0x00)
          out = VSAValue();
        else if (marker == 0x08)
          out = VSAValue(false);
        else if (marker == 0x09)
          out = VSAValue(true);
        else
          return bad("unsupported simple value");
        return true;
      case 0x10:
        return readInteger(pos, low, out);
      case 0x20:
      case 0x30: {
        int size = 1 << low;
        if ((size != 4 && size != 8) || (high == 0x30 && size != 8)) return bad("bad real size");
        if (!fits(pos, size, 1)) return false;
        uint64_t bits = readBE(pos, size);
        double v = size == 4
                       ? static_cast<double>(std::bit_cast<float>(static_cast<uint32_t>(bits)))
                       : std::bit_cast<double>(bits);
        out = high == 0x20 ? VSAValue(v) : VSAValue(VSADate{v});
        return true;
      }
      case 0x40: {
        uint64_t count;
        if (!readCount(pos, low, count) || !fits(pos, count, 1) || !charge(count)) return false;
        out = VSAValue(VSAValue::Data(d_ + pos, d_ + pos + count));
        return true;
      }
      case 0x50: {
        uint64_t count;
        // Each byte becomes at least one UTF-8 byte: that much is charged
        // before the string is built, the rest once its length is known.
        if (!readCount(pos, low, count) || !fits(pos, count, 1) || !charge(count)) return false;
        // One-byte strings are ASCII (copied as they are); stray high bytes
        // are taken as Latin-1 so that every decoded string is valid UTF-8.
        const uint8_t* bytes = d_ + pos;
        if (std::all_of(bytes, bytes + count, [](uint8_t b) { return b < 0x80; })) {
          out = VSAValue(std::string(reinterpret_cast<const char*>(bytes), count));
          return true;
        }
        std::string s;
        s.reserve(count);
        for (uint64_t i = 0; i < count; ++i) VSAAppendUTF8(s, bytes[i]);
        if (!charge(s.size() - count)) return false;
        out = VSAValue(std::move(s));
        return true;
      }
      case 0x60:
        return readUTF16(pos, low, out);
      case 0xA0:
      case 0xD0:
        return readCollection(index, pos, high, low, depth, out);
      default:
        return bad("unsupported object type");
    }
  }

  bool readInteger(size_t pos, uint8_t low, VSAValue& out) {
    if (low > 4) return bad("bad integer size");
    int size = 1 << low;
    if (!fits(pos, size, 1)) return false;
    if (size < 8) {
      out = VSAValue(static_cast<uint64_t>(readBE(pos, size)));
    } else if (size == 8) {
      out = VSAValue(static_cast<int64_t>(readBE(pos, 8)));
      if (*out.int64Value() >= 0) out = VSAValue(*out.uint64Value());
    } else {
      uint64_t hi = readBE(pos, 8), lo = readBE(pos + 8, 8);
      if (hi == 0)
        out = VSAValue(lo);
      else if (hi == ~0ull && (lo >> 63))
        out = VSAValue(static_cast<int64_t>(lo));
      else
        return bad("integer out of range");
    }
    return true;
  }

  bool readUTF16(size_t pos, uint8_t low, VSAValue& out) {
    uint64_t count;
    // Each UTF-16 unit becomes at least one UTF-8 byte (charged now), a pair
    // at most four; the rest is charged once the string is built.
    if (!readCount(pos, low, count) || !fits(pos, count, 2) || !charge(count)) return false;
    std::string s;
    s.reserve(count);
    for (uint64_t i = 0; i < count; ++i) {
      uint32_t u = static_cast<uint32_t>(readBE(pos + 2 * i, 2));
      if (u >= 0xD800 && u <= 0xDBFF) {
        if (i + 1 >= count) return bad("unpaired surrogate");
        uint32_t lo = static_cast<uint32_t>(readBE(pos + 2 * (i + 1), 2));
        if (lo < 0xDC00 || lo > 0xDFFF) return bad("unpaired surrogate");
        u = 0x10000 + ((u - 0xD800) << 10) + (lo - 0xDC00);
        ++i;
      } else if (u >= 0xDC00 && u <= 0xDFFF) {
        return bad("unpaired surrogate");
      }
      VSAAppendUTF8(s, u);
    }
    if (!charge(s.size() - count)) return false;
    out = VSAValue(std::move(s));
    return true;
  }

  bool readCollection(uint64_t index, size_t pos, uint8_t high, uint8_t low, int depth,
                      VSAValue& out) {
    uint64_t count;
    if (!readCount(pos, low, count)) return false;
    uint64_t refs = high == 0xD0 ? count * 2 : count;
    if (high == 0xD0 && count > std::numeric_limits<uint64_t>::max() / 2) return bad("bad count");
    if (!fits(pos, refs, refSize_)) return false;
    if (visiting_[index]) return bad("reference cycle");
    visiting_[index] = 1;
    bool ok = true;
    if (high == 0xA0) {
      VSAValue::Array a;
      // Every element costs at least kValueCost, so no more than the rest of
      // the budget allows is reserved up front.
      a.reserve(std::min<uint64_t>(count, (budget_ - spent_) / VSABinaryPlist::kValueCost));
      for (uint64_t i = 0; ok && i < count; ++i) {
        VSAValue child;
        ok = readObject(readBE(pos + i * refSize_, refSize_), depth + 1, child);
        a.push_back(std::move(child));
      }
      if (ok) out = VSAValue(std::move(a));
    } else {
      VSAValue::Dictionary d;
      for (uint64_t i = 0; ok && i < count; ++i) {
        VSAValue key, value;
        ok = readObject(readBE(pos + i * refSize_, refSize_), depth + 1, key) &&
             readObject(readBE(pos + (count + i) * refSize_, refSize_), depth + 1, value);
        if (ok && !key.isString()) ok = bad("dictionary key is not a string");
        if (ok) d[*key.stringValue()] = std::move(value);
      }
      if (ok) out = VSAValue(std::move(d));
    }
    visiting_[index] = 0;
    return ok;
  }

  const uint8_t* d_;
  size_t n_;
  int offsetSize_ = 0, refSize_ = 0;
  uint64_t numObjects_ = 0, top_ = 0, tableOffset_ = 0;
  std::vector<uint8_t> visiting_;
  size_t decoded_ = 0;
  uint64_t budget_ = 0, spent_ = 0;
  std::string why_;
};

}  // namespace

bool VSABinaryPlist::isBinaryPlist(const uint8_t* bytes, size_t length) {
  return length >= 8 && std::memcmp(bytes, "bplist0", 7) == 0;
}

std::optional<std::vector<uint8_t>> VSABinaryPlist::encode(const VSAValue& value, UUIDForm form,
                                                           std::string* error) {
  return Encoder(form).run(value, error);
}

size_t VSABinaryPlist::decodedSizeBudget(size_t inputLength) {
  constexpr size_t kMax = std::numeric_limits<size_t>::max();
  if (inputLength > (kMax - kDecodedBytesAllowance) / kDecodedBytesPerInputByte) return kMax;
  return inputLength * kDecodedBytesPerInputByte + kDecodedBytesAllowance;
}

size_t VSABinaryPlist::decodedSize(const VSAValue& value) {
  size_t size = kValueCost;
  if (auto s = value.stringValue()) {
    size += s->size();
  } else if (auto d = value.dataValue()) {
    size += d->size();
  } else if (auto a = value.arrayValue()) {
    for (const VSAValue& child : *a) size += decodedSize(child);
  } else if (auto dict = value.dictionaryValue()) {
    for (const auto& [key, child] : *dict) size += kValueCost + key.size() + decodedSize(child);
  }
  return size;
}

std::optional<VSAValue> VSABinaryPlist::decode(const uint8_t* bytes, size_t length,
                                               std::string* error) {
  // The budget keeps a hostile list small, but a daemon short of memory
  // must still answer "cannot decode" rather than end.
  try {
    return Decoder(bytes, length).run(error);
  } catch (const std::bad_alloc&) {
  } catch (const std::length_error&) {
  }
  if (error) *error = "out of memory while decoding";
  return std::nullopt;
}
