#include "common/STWMessagePack.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWLog.h"

#include <msgpack.hpp>

#include <cstring>
#include <exception>
#include <limits>

namespace {

constexpr int8_t kUUIDExtType = 1;
constexpr int8_t kTimestampExtType = -1;
constexpr uint32_t kNanosecondsPerSecond = 1000000000;

void putBigEndian(char* out, uint64_t value, size_t width) {
    for (size_t i = 0; i < width; ++i)
        out[i] = static_cast<char>(value >> (8 * (width - 1 - i)));
}

uint64_t getBigEndian(const unsigned char* in, size_t width) {
    uint64_t value = 0;
    for (size_t i = 0; i < width; ++i)
        value = value << 8 | in[i];
    return value;
}

// MessagePack lengths are 32-bit; nothing the daemon sends comes near (frames are far
// smaller), so an oversized item is a bug of the sender, written as nil.
bool fitsLength(size_t size) {
    if (size <= std::numeric_limits<uint32_t>::max())
        return true;
    STW_LOG_FAULT(STWLogCategory::Unspecified, "Value of %zu elements is too large for the IPC codec", size);
    return false;
}

// Writes through msgpack-cxx's packer straight into the caller's string, except for what
// msgpack-cxx writes differently from what the protocol needs.
class Encoder {
public:
    explicit Encoder(std::string& out) : _stream{out}, _packer(_stream) {}

    void pack(const STWValue& value) {
        switch (value.type()) {
        case STWValue::Type::Null:
            _packer.pack_nil();
            return;
        case STWValue::Type::Bool:
            *value.boolValue() ? _packer.pack_true() : _packer.pack_false();
            return;
        case STWValue::Type::Integer:
            if (auto u = value.uint64Value())
                _packer.pack_uint64(*u);
            else
                _packer.pack_int64(*value.int64Value());
            return;
        case STWValue::Type::Real:
            _packDouble(*value.realValue());
            return;
        case STWValue::Type::String:
            _packString(*value.string());
            return;
        case STWValue::Type::Data: {
            const STWData& d = *value.data();
            if (!fitsLength(d.size()))
                break;
            _packer.pack_bin(static_cast<uint32_t>(d.size()));
            _packer.pack_bin_body(reinterpret_cast<const char*>(d.data()), static_cast<uint32_t>(d.size()));
            return;
        }
        case STWValue::Type::Date:
            _packDate(*value.date());
            return;
        case STWValue::Type::UUID:
            _packer.pack_ext(16, kUUIDExtType);
            _packer.pack_ext_body(reinterpret_cast<const char*>(value.uuid()->bytes.data()), 16);
            return;
        case STWValue::Type::Array: {
            const STWValue::Array& a = *value.array();
            if (!fitsLength(a.size()))
                break;
            _packer.pack_array(static_cast<uint32_t>(a.size()));
            for (const STWValue& element : a)
                pack(element);
            return;
        }
        case STWValue::Type::Dictionary:
            packDictionary(*value.dictionary());
            return;
        }
        _packer.pack_nil();
    }

    void packDictionary(const STWValue::Dictionary& d) {
        if (!fitsLength(d.size())) {
            _packer.pack_nil();
            return;
        }
        _packer.pack_map(static_cast<uint32_t>(d.size()));
        for (const auto& [key, element] : d) {
            _packString(key);
            pack(element);
        }
    }

private:
    // Appends straight into the result so that encoding copies nothing twice.
    struct StringStream {
        std::string& out;
        void write(const char* bytes, size_t length) { out.append(bytes, length); }
    };

    void _packString(const std::string& s) {
        if (!fitsLength(s.size())) {
            _packer.pack_nil();
            return;
        }
        _packer.pack_str(static_cast<uint32_t>(s.size()));
        _packer.pack_str_body(s.data(), static_cast<uint32_t>(s.size()));
    }

    // Always float64. msgpack-cxx's pack_double writes a double without a fraction as an
    // integer, which would turn a real into an integer (and -0.0 into 0) on the other side.
    void _packDouble(double d) {
        uint64_t bits;
        memcpy(&bits, &d, sizeof bits);
        char buffer[9] = {static_cast<char>(0xcb)};
        putBigEndian(buffer + 1, bits, 8);
        _stream.write(buffer, sizeof buffer);
    }

    void _packDate(STWDate date) {
        // Carry out-of-range nanoseconds into the seconds so the timestamp stays valid.
        if (date.nanoseconds >= kNanosecondsPerSecond) {
            int64_t carry = date.nanoseconds / kNanosecondsPerSecond;
            if (date.seconds <= std::numeric_limits<int64_t>::max() - carry)
                date.seconds += carry;
            date.nanoseconds %= kNanosecondsPerSecond;
        }
        char body[12];
        if (date.seconds >= 0 && date.seconds < (int64_t(1) << 34)) {
            // timestamp 64: 30 bits of nanoseconds over 34 bits of seconds.
            putBigEndian(body, uint64_t(date.nanoseconds) << 34 | uint64_t(date.seconds), 8);
            _packer.pack_ext(8, kTimestampExtType);
            _packer.pack_ext_body(body, 8);
        } else {
            // timestamp 96: 32 bits of nanoseconds, then signed 64-bit seconds.
            putBigEndian(body, date.nanoseconds, 4);
            putBigEndian(body + 4, static_cast<uint64_t>(date.seconds), 8);
            _packer.pack_ext(12, kTimestampExtType);
            _packer.pack_ext_body(body, 12);
        }
    }

    StringStream _stream;
    msgpack::packer<StringStream> _packer;
};

// Walks the raw bytes once before msgpack-cxx sees them. msgpack-cxx allocates an array's
// or map's element storage as soon as it reads the header, so a five-byte input declaring
// four billion elements would make it try to allocate about a hundred gigabytes; and a
// header nested inside another would do so again at every level. Here every declared
// length and count is compared to the bytes that remain, and each object really has to
// be present before the next is looked at, so everything allocated afterwards is bounded
// by a small multiple of the input size. No allocation happens during the walk.
class Scanner {
public:
    Scanner(const unsigned char* bytes, size_t size, size_t maxObjects)
        : _p(bytes), _n(size), _maxObjects(maxObjects) {}

    bool scan(std::string* reason) {
        uint64_t pending[STWMessagePackMaxDepth];
        size_t depth = 0;
        size_t objects = 0;
        for (;;) {
            uint64_t skip = 0;     // bytes of payload after the header
            uint64_t children = 0; // items inside a container
            bool container = false;
            if (_pos >= _n)
                return fail(reason, "truncated input");
            unsigned char b = _p[_pos++];
            if (b <= 0x7f || b >= 0xe0) {
                // positive or negative fixint
            } else if (b <= 0x8f) {
                container = true;
                children = 2 * uint64_t(b & 0x0f);
            } else if (b <= 0x9f) {
                container = true;
                children = b & 0x0f;
            } else if (b <= 0xbf) {
                skip = b & 0x1f;
            } else {
                switch (b) {
                case 0xc0: // nil
                case 0xc2: // false
                case 0xc3: // true
                    break;
                case 0xc1:
                    return fail(reason, "reserved type byte 0xc1");
                case 0xc4: // bin 8/16/32
                case 0xc5:
                case 0xc6:
                    if (!length(size_t(1) << (b - 0xc4), skip))
                        return fail(reason, "truncated input");
                    break;
                case 0xc7: // ext 8/16/32, plus the type byte
                case 0xc8:
                case 0xc9:
                    if (!length(size_t(1) << (b - 0xc7), skip))
                        return fail(reason, "truncated input");
                    ++skip;
                    break;
                case 0xca: // float 32/64
                    skip = 4;
                    break;
                case 0xcb:
                    skip = 8;
                    break;
                case 0xcc: // uint 8..64
                case 0xcd:
                case 0xce:
                case 0xcf:
                    skip = size_t(1) << (b - 0xcc);
                    break;
                case 0xd0: // int 8..64
                case 0xd1:
                case 0xd2:
                case 0xd3:
                    skip = size_t(1) << (b - 0xd0);
                    break;
                case 0xd4: // fixext 1..16, plus the type byte
                case 0xd5:
                case 0xd6:
                case 0xd7:
                case 0xd8:
                    skip = (size_t(1) << (b - 0xd4)) + 1;
                    break;
                case 0xd9: // str 8/16/32
                case 0xda:
                case 0xdb:
                    if (!length(size_t(1) << (b - 0xd9), skip))
                        return fail(reason, "truncated input");
                    break;
                case 0xdc: // array 16/32
                case 0xdd:
                    container = true;
                    if (!length(b == 0xdc ? 2 : 4, children))
                        return fail(reason, "truncated input");
                    break;
                case 0xde: // map 16/32: a key and a value per entry
                case 0xdf:
                    container = true;
                    if (!length(b == 0xde ? 2 : 4, children))
                        return fail(reason, "truncated input");
                    children *= 2;
                    break;
                }
            }
            if (skip > _n - _pos)
                return fail(reason, "declared length beyond the end of the input");
            _pos += skip;
            if (++objects > _maxObjects)
                return fail(reason, "too many objects");
            if (container) {
                // Every item takes at least one byte.
                if (children > _n - _pos)
                    return fail(reason, "declared count beyond the end of the input");
                if (depth == STWMessagePackMaxDepth)
                    return fail(reason, "nested too deeply");
                if (children > 0) {
                    pending[depth++] = children;
                    continue;
                }
            }
            // One item is complete: close every container it completes.
            while (depth > 0 && --pending[depth - 1] == 0)
                --depth;
            if (depth == 0)
                break;
        }
        if (_pos != _n)
            return fail(reason, "trailing bytes after the object");
        return true;
    }

private:
    bool length(size_t width, uint64_t& value) {
        if (width > _n - _pos)
            return false;
        value = getBigEndian(_p + _pos, width);
        _pos += width;
        return true;
    }

    static bool fail(std::string* reason, const char* why) {
        if (reason)
            *reason = why;
        return false;
    }

    const unsigned char* _p;
    size_t _n;
    size_t _maxObjects;
    size_t _pos = 0;
};

std::optional<STWValue> extValue(const msgpack::object_ext& ext) {
    const auto* body = reinterpret_cast<const unsigned char*>(ext.data());
    if (ext.type() == kUUIDExtType && ext.size == 16) {
        STWUUID uuid;
        memcpy(uuid.bytes.data(), body, 16);
        return STWValue(uuid);
    }
    if (ext.type() == kTimestampExtType) {
        STWDate date;
        if (ext.size == 4) {
            date.seconds = static_cast<int64_t>(getBigEndian(body, 4));
        } else if (ext.size == 8) {
            uint64_t bits = getBigEndian(body, 8);
            date.nanoseconds = static_cast<uint32_t>(bits >> 34);
            date.seconds = static_cast<int64_t>(bits & ((uint64_t(1) << 34) - 1));
        } else if (ext.size == 12) {
            date.nanoseconds = static_cast<uint32_t>(getBigEndian(body, 4));
            date.seconds = static_cast<int64_t>(getBigEndian(body + 4, 8));
        } else {
            return std::nullopt;
        }
        if (date.nanoseconds >= kNanosecondsPerSecond)
            return std::nullopt;
        return STWValue(date);
    }
    return std::nullopt;
}

std::optional<std::string> stringValue(const char* bytes, uint32_t size) {
    if (size == 0)
        return std::string();
    return stringWithFileSystemRepresentation(bytes, size);
}

// Converts what msgpack-cxx read. The scanner has bounded the depth, so recursion is safe.
bool convert(const msgpack::object& object, STWValue& out, std::string* reason) {
    switch (object.type) {
    case msgpack::type::NIL:
        out = STWValue();
        return true;
    case msgpack::type::BOOLEAN:
        out = STWValue(object.via.boolean);
        return true;
    case msgpack::type::POSITIVE_INTEGER:
        out = STWValue(object.via.u64);
        return true;
    case msgpack::type::NEGATIVE_INTEGER:
        out = STWValue(object.via.i64);
        return true;
    case msgpack::type::FLOAT32:
    case msgpack::type::FLOAT64:
        out = STWValue(object.via.f64);
        return true;
    case msgpack::type::STR: {
        auto s = stringValue(object.via.str.ptr, object.via.str.size);
        if (!s) {
            if (reason)
                *reason = "string that is not UTF-8 or contains a NUL";
            return false;
        }
        out = STWValue(std::move(*s));
        return true;
    }
    case msgpack::type::BIN: {
        const auto* p = reinterpret_cast<const uint8_t*>(object.via.bin.ptr);
        out = STWValue(object.via.bin.size ? STWData(p, p + object.via.bin.size) : STWData());
        return true;
    }
    case msgpack::type::EXT:
        out = extValue(object.via.ext).value_or(STWValue());
        return true;
    case msgpack::type::ARRAY: {
        STWValue::Array array(object.via.array.size);
        for (uint32_t i = 0; i < object.via.array.size; ++i)
            if (!convert(object.via.array.ptr[i], array[i], reason))
                return false;
        out = STWValue(std::move(array));
        return true;
    }
    case msgpack::type::MAP: {
        STWValue::Dictionary dictionary;
        for (uint32_t i = 0; i < object.via.map.size; ++i) {
            const msgpack::object_kv& kv = object.via.map.ptr[i];
            if (kv.key.type != msgpack::type::STR) {
                if (reason)
                    *reason = "map key that is not a string";
                return false;
            }
            auto key = stringValue(kv.key.via.str.ptr, kv.key.via.str.size);
            if (!key) {
                if (reason)
                    *reason = "map key that is not UTF-8 or contains a NUL";
                return false;
            }
            auto [slot, inserted] = dictionary.try_emplace(std::move(*key));
            if (!inserted) {
                if (reason)
                    *reason = "duplicate map key";
                return false;
            }
            if (!convert(kv.val, slot->second, reason))
                return false;
        }
        out = STWValue(std::move(dictionary));
        return true;
    }
    }
    if (reason)
        *reason = "unknown object type";
    return false;
}

// Strings and binary data are converted while the input is alive, so msgpack-cxx may
// point into it instead of copying.
bool referenceInput(msgpack::type::object_type, size_t, void*) {
    return true;
}

} // namespace

std::string STWMessagePackEncode(const STWValue& value) {
    std::string out;
    STWMessagePackAppend(out, value);
    return out;
}

void STWMessagePackAppend(std::string& out, const STWValue& value) {
    Encoder(out).pack(value);
}

void STWMessagePackAppendDictionary(std::string& out, const STWValue::Dictionary& dictionary) {
    Encoder(out).packDictionary(dictionary);
}

std::optional<STWValue> STWMessagePackDecode(std::string_view bytes, std::string* reason, size_t maxObjects) {
    const auto* p = reinterpret_cast<const unsigned char*>(bytes.data());
    if (!Scanner(p, bytes.size(), maxObjects).scan(reason))
        return std::nullopt;
    try {
        // The scanner has checked all of this already; the limits are a second fence.
        size_t n = bytes.size();
        msgpack::unpack_limit limit(n, n, n, n, n, STWMessagePackMaxDepth);
        size_t offset = 0;
        msgpack::object_handle handle =
            msgpack::unpack(bytes.data(), bytes.size(), offset, referenceInput, nullptr, limit);
        if (offset != bytes.size()) {
            if (reason)
                *reason = "trailing bytes after the object";
            return std::nullopt;
        }
        STWValue value;
        if (!convert(handle.get(), value, reason))
            return std::nullopt;
        return value;
    } catch (const std::exception& e) {
        if (reason)
            *reason = e.what();
        return std::nullopt;
    }
}
