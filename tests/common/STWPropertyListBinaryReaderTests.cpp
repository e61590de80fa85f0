// The direct reader of binary property lists must agree with libplist on every input it
// accepts, and accept the files the daemon writes itself.
#include "common/STWPropertyList.h"

#include <gtest/gtest.h>

#include <random>

inline void PrintTo(const STWValue& value, std::ostream* os) {
    *os << value.description();
}

namespace {

// Values, not encodings, are compared: libplist's writer shares data objects by address.
bool same(const std::optional<STWValue>& a, const std::optional<STWValue>& b) {
    return a && b ? a->isIdenticalTo(*b) : !a && !b;
}

class RandomTrees {
public:
    explicit RandomTrees(uint32_t seed) : _random(seed) {}

    STWValue value(int depth) {
        switch (pick(depth < 4 ? 11 : 9)) {
        case 0:
            return STWValue(pick(2) == 1);
        case 1:
            return STWValue(static_cast<uint64_t>(_random()) >> pick(64));
        case 2:
            return STWValue(-static_cast<int64_t>(_random() % 100000) - 1);
        case 3:
            // Reals that fit a float are written in four bytes, the others in eight.
            return pick(2) ? STWValue(0.5 * pick(1000)) : STWValue(1.0 / (pick(1000) + 3));
        case 4:
            return STWValue(text());
        case 5:
            return STWValue("caf\xc3\xa9 " + text()); // not ASCII: written as UTF-16
        case 6: {
            STWData data(pick(40));
            for (auto& byte : data)
                byte = static_cast<uint8_t>(_random());
            return STWValue(std::move(data));
        }
        case 7:
            return STWValue(STWDate{1700000000 + static_cast<int64_t>(pick(100000)), 0});
        case 8:
            return STWValue(std::string("2")); // shared by every use in the file
        case 9: {
            STWValue::Array array;
            for (unsigned i = pick(6); i > 0; --i)
                array.push_back(value(depth + 1));
            return STWValue(std::move(array));
        }
        default: {
            STWValue::Dictionary dictionary;
            for (unsigned i = pick(7); i > 0; --i)
                dictionary[pick(8) ? text() : "k\xc3\xa9y" + text()] = value(depth + 1);
            return STWValue(std::move(dictionary));
        }
        }
    }
    unsigned pick(unsigned n) { return static_cast<unsigned>(_random() % n); }

private:
    std::string text() {
        std::string s(pick(30), 'a');
        for (char& c : s)
            c = static_cast<char>('a' + pick(26));
        return s;
    }
    std::mt19937 _random;
};

// The dictionary of a container's metadata file, as the daemon writes it.
STWValue metadataLike() {
    STWValue::Dictionary identity{{"posixUID", STWValue(501)},
                                  {"posixGID", STWValue(501)},
                                  {"type", STWValue(0)},
                                  {"version", STWValue("2")}};
    return STWValue(STWValue::Dictionary{
        {"STWMetadataContentClass", STWValue(2)},
        {"STWMetadataIdentifier", STWValue("com.example.app")},
        {"STWMetadataUUID", STWValue("8A0C1C0E-6C1B-4F5B-9C7E-2D6F3B1A9E42")},
        {"STWMetadataVersion", STWValue("2")},
        {"STWMetadataUserIdentity", STWValue(identity)},
        {"STWMetadataInfo", STWValue(STWValue::Dictionary{{"com.vorlane.Setwright.ContentProtectionClass",
                                                          STWValue(3)}})},
    });
}

TEST(STWPropertyListBinaryReaderTest, ReadsAsLibplistDoesTheDaemonsOwnFilesAndDamagedOnes) {
    std::string bytes = STWPropertyList::serializeBinary(metadataLike());
    auto direct = STWPropertyList::_parseBinaryDirectly(bytes);
    ASSERT_TRUE(direct); // the hot path must not decline what the daemon writes
    EXPECT_EQ(*direct, metadataLike());
    EXPECT_EQ(*direct, *STWPropertyList::_parseWithLibplist(bytes));

    RandomTrees trees(7);
    int accepted = 0;
    for (int i = 0; i < 400; ++i) {
        STWValue tree = trees.value(0);
        std::string encoded = STWPropertyList::serializeBinary(tree);
        auto reference = STWPropertyList::_parseWithLibplist(encoded);
        auto read = STWPropertyList::_parseBinaryDirectly(encoded);
        if (read) {
            ++accepted;
            EXPECT_TRUE(same(read, reference)) << tree.description();
        }
        EXPECT_TRUE(same(STWPropertyList::parse(encoded), reference)) << tree.description();
    }
    // Trees without dates or non-ASCII text are common enough that most are read directly.
    EXPECT_GT(accepted, 100);

    // Damaged files: whatever the reader accepts, libplist reads the same.
    std::vector<std::string> files{bytes};
    for (int i = 0; i < 6; ++i)
        files.push_back(STWPropertyList::serializeBinary(STWValue(STWValue::Array{trees.value(0), metadataLike()})));
    int acceptedDamaged = 0;
    for (const std::string& original : files) {
        for (int round = 0; round < 3000; ++round) {
            std::string damaged = original;
            // Object bytes and trailer fields alike: counts, offsets, references, markers.
            for (unsigned n = trees.pick(3) + 1; n > 0; --n) {
                size_t at = trees.pick(static_cast<unsigned>(damaged.size()));
                static const uint8_t interesting[] = {0x00, 0x01, 0x0f, 0x10, 0x13, 0x14, 0x5f, 0x7f, 0x80, 0xd1, 0xff};
                damaged[at] = static_cast<char>(trees.pick(2) ? interesting[trees.pick(sizeof interesting)]
                                                              : static_cast<uint8_t>(trees.pick(256)));
            }
            if (trees.pick(10) == 0)
                damaged.resize(trees.pick(static_cast<unsigned>(damaged.size())));
            auto reference = STWPropertyList::_parseWithLibplist(damaged);
            if (auto read = STWPropertyList::_parseBinaryDirectly(damaged)) {
                acceptedDamaged += damaged != original;
                ASSERT_TRUE(same(read, reference)) << "round " << round << ": " << read->description();
            }
        }
    }
    // Many changes keep the file valid (a changed letter or number); those are compared too.
    EXPECT_GT(acceptedDamaged, 1000);
}

// A binary property list built by hand: `objects` in order, one-byte offsets and references.
std::string handMade(const std::vector<std::string>& objects, uint8_t root = 0) {
    std::string bytes = "bplist00";
    std::vector<uint64_t> offsets;
    for (const std::string& object : objects) {
        offsets.push_back(bytes.size());
        bytes += object;
    }
    uint64_t table = bytes.size();
    for (uint64_t offset : offsets)
        bytes += static_cast<char>(offset); // one-byte offsets: the files stay small
    std::string trailer(32, '\0');
    trailer[6] = 1;
    trailer[7] = 1;
    trailer[15] = static_cast<char>(objects.size());
    trailer[23] = static_cast<char>(root);
    trailer[31] = static_cast<char>(table);
    return bytes + trailer;
}

TEST(STWPropertyListBinaryReaderTest, HostileStructuresAreLeftToLibplist) {
    // An array holding itself, a dictionary whose key is itself, a sixteen-byte integer, a
    // UTF-16 key: declined, and parse() answers as libplist does.
    std::vector<std::string> hostile{
        handMade({std::string("\xa1\x00", 2)}),
        handMade({std::string("\xd1\x00\x01", 3), "\x51x"}),
        handMade({std::string("\x14", 1) + std::string(15, '\0') + "\x05"}),
        handMade({std::string("\xd1\x01\x02", 3), std::string("\x61\x00\xe9", 3), std::string("\x09", 1)}),
        handMade({std::string("\xa2\x01\x01", 3), std::string("\x00", 1)}),
    };
    for (const std::string& bytes : hostile) {
        EXPECT_FALSE(STWPropertyList::_parseBinaryDirectly(bytes));
        EXPECT_TRUE(same(STWPropertyList::parse(bytes), STWPropertyList::_parseWithLibplist(bytes)));
    }
    EXPECT_FALSE(STWPropertyList::parse(hostile[0]));
    // A NUL in a string, a key (which libplist would abort on) or a UTF-16 key: refused
    // before libplist sees it.
    for (const std::string& bytes :
         {handMade({std::string("\x53" "a\0b", 4)}),
          handMade({std::string("\xd1\x01\x02", 3), std::string("\x53" "a\0b", 4), "\x09"}),
          handMade({std::string("\xd1\x01\x02", 3), std::string("\x61\x00\x00", 3), "\x09"})})
        EXPECT_FALSE(STWPropertyList::parse(bytes));

    // Containers whose references run past the objects into the offset table, whose first
    // byte (8) is then a valid index: libplist refuses them, and so must the reader.
    std::vector<std::string> trues(9, "\x09");
    std::vector<std::string> longArray = trues, longDictionary = trues;
    longArray.push_back(std::string("\xa2\x01", 2));
    longDictionary[1] = "\x51k";
    longDictionary.push_back(std::string("\xd1\x01", 2));
    for (const std::string& bytes : {handMade(longArray, 9), handMade(longDictionary, 9)}) {
        EXPECT_FALSE(STWPropertyList::_parseBinaryDirectly(bytes));
        EXPECT_FALSE(STWPropertyList::parse(bytes));
    }
    // The same containers with their references in place are read directly.
    longArray.back() = std::string("\xa2\x01\x02", 3);
    longDictionary.back() = std::string("\xd1\x01\x02", 3);
    EXPECT_EQ(STWPropertyList::_parseBinaryDirectly(handMade(longArray, 9)),
              STWValue(STWValue::Array{STWValue(true), STWValue(true)}));
    EXPECT_EQ(STWPropertyList::_parseBinaryDirectly(handMade(longDictionary, 9)),
              STWValue(STWValue::Dictionary{{"k", STWValue(true)}}));

    // One shared object referenced twice at every level: the reader reads it once per use,
    // within a budget proportional to the file.
    std::vector<std::string> levels;
    for (int i = 0; i < 12; ++i)
        levels.push_back(std::string("\xa2", 1) + static_cast<char>(i + 1) + static_cast<char>(i + 1));
    levels.push_back("\x10\x07");
    std::string fanOut = handMade(levels);
    EXPECT_FALSE(STWPropertyList::_parseBinaryDirectly(fanOut));
    EXPECT_TRUE(same(STWPropertyList::parse(fanOut), STWPropertyList::_parseWithLibplist(fanOut)));

    // Nesting: both routes agree on either side of the depth the daemon accepts.
    for (int depth : {100, 511, 513}) {
        STWValue nested(STWValue::Array{});
        for (int i = 0; i < depth; ++i)
            nested = STWValue(STWValue::Array{nested});
        std::string bytes = STWPropertyList::serializeBinary(nested);
        EXPECT_TRUE(same(STWPropertyList::parse(bytes), STWPropertyList::_parseWithLibplist(bytes))) << depth;
    }
}

} // namespace
