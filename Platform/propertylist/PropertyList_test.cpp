#include "Platform/propertylist/PropertyList.h"

#include <gtest/gtest.h>

#include <array>
#include <random>
#include <tuple>
#include <vector>

#include "TestSupport/PropertyListCases.h"

namespace platform {
namespace {

std::string readBack(Bytes list) { return readBack(list, readBinaryPropertyList); }

/// An array of the same element.
ValueWriter repeated(int times, const ValueWriter& element) {
    return [=](ValueSink& sink) {
        sink.beginArray();
        for (int i = 0; i < times; ++i) element(sink);
        sink.endArray();
    };
}

/// The sample of both forms, and what only this form has or writes in several ways.
void writeLargeSample(ValueSink& sink) {
    const std::array<uint8_t, 16> uuid = {1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15, 16};
    const std::string longText(300, 'x');
    sink.beginArray(), writeSample(sink), sink.null(), sink.singleReal(1.5F), sink.uuid(uuid);
    for (const int64_t value : {127, 128, 255, 256, 65535, 65536}) sink.integer(value);
    sink.integer(UINT32_MAX), sink.integer(int64_t{UINT32_MAX} + 1);
    for (const double seconds : {1700000000.25, -5e9}) sink.date(seconds);
    sink.data(uuid), sink.data(bytesOf(longText)), sink.string(longText);
    for (const std::string_view text : {"plain", "Zoë", "plain"}) sink.string(text);
    sink.string(std::string_view("a\0b", 3)), sink.endArray();
}

TEST(PropertyList, EveryKindReadsBackAsWritten) {
    const std::pair<const char*, ValueWriter> cases[] = {
        {"sample", writeLargeSample},
        {"deepest", nested(kMaxPropertyListDepth)},
        {"many members",
         [](ValueSink& sink) {
             sink.beginArray();
             for (int64_t i = 0; i < 70000; ++i) sink.integer(i);
             sink.endArray();
         }},
    };
    for (const auto& [name, writer] : cases)
        EXPECT_EQ(readBack(writeBinaryPropertyList(writer)), written(writer)) << name;
    EXPECT_EQ(readBack(writeBinaryPropertyList([](ValueSink& sink) { sink.unsignedInteger(7); })), "i7");
}

TEST(PropertyList, RefusesToWriteWhatCouldNotBeRead) {
    const std::pair<const char*, ValueWriter> cases[] = {
        {"nothing", [](ValueSink&) {}},
        {"two values", [](ValueSink& s) { s.boolean(true), s.boolean(true); }},
        {"a descriptor", [](ValueSink& s) { s.beginArray(), s.fileDescriptor(0), s.endArray(); }},
        {"an open array", [](ValueSink& s) { s.beginArray(); }},
        {"an end without begin", [](ValueSink& s) { s.boolean(true), s.endArray(); }},
        {"the wrong end", [](ValueSink& s) { s.beginArray(), s.endDictionary(); }},
        {"a value without key",
         [](ValueSink& s) { s.beginDictionary(), s.boolean(true), s.endDictionary(); }},
        {"a key without value", [](ValueSink& s) { s.beginDictionary(), s.key("k"), s.endDictionary(); }},
        {"two keys in a row",
         [](ValueSink& s) {
             s.beginDictionary(), s.key("k"), s.key("l"), s.boolean(true), s.endDictionary();
         }},
        {"a key in an array", [](ValueSink& s) { s.beginArray(), s.key("k"), s.endArray(); }},
        {"too deep", nested(kMaxPropertyListDepth + 1)},
        {"a lone continuation", [](ValueSink& s) { s.string("\x80"); }},
        {"an overlong form", [](ValueSink& s) { s.string("\xC0\xAF"); }},
        {"an overlong form of three", [](ValueSink& s) { s.string("\xE0\x80\xAF"); }},
        {"a surrogate", [](ValueSink& s) { s.string("\xED\xA0\x80"); }},
        {"beyond Unicode", [](ValueSink& s) { s.string("\xF4\x90\x80\x80"); }},
        {"cut text", [](ValueSink& s) { s.string("\xE2\x82"); }},
    };
    for (const auto& [name, writer] : cases) EXPECT_TRUE(writeBinaryPropertyList(writer).empty()) << name;
}

TEST(PropertyList, SharesEqualTexts) {
    const auto list = writeBinaryPropertyList(
        repeated(100, [](ValueSink& sink) { sink.string("the same text of some length"); }));
    EXPECT_LT(list.size(), 250U);
}

TEST(PropertyList, DamagedListsAreRefusedOrAreOtherLists) {
    const SecretBytes list = writeBinaryPropertyList(writeLargeSample);
    for (size_t size = 0; size < list.size(); ++size) {
        // A copy of exactly this size, so that reading beyond it is seen.
        EXPECT_EQ(readBack(SecretBytes(list.begin(), list.begin() + static_cast<ptrdiff_t>(size))), "refused")
            << size;
    }
    std::minstd_rand random(20);
    for (int round = 0; round < 4000; ++round) {
        SecretBytes flipped = list;
        for (auto flips = 1 + random() % 3; flips > 0; --flips) {
            flipped[random() % flipped.size()] ^= static_cast<uint8_t>(1U << random() % 8);
        }
        const std::string text = readBack(flipped);
        if (text == "refused") continue;
        // Whatever is accepted is a sound value: it can be written and read again.
        const auto again =
            writeBinaryPropertyList([&](ValueSink& sink) { readBinaryPropertyList(flipped, sink); });
        EXPECT_FALSE(again.empty()) << text;
    }
}

/// A list of the given objects with one-byte offsets and references; the first object is the top.
SecretBytes listOf(const std::vector<std::vector<uint8_t>>& objects) {
    SecretBytes list = {'b', 'p', 'l', 'i', 's', 't', '0', '0'};
    SecretBytes offsets;
    for (const auto& object : objects) {
        offsets.push_back(static_cast<uint8_t>(list.size()));
        list.insert(list.end(), object.begin(), object.end());
    }
    const auto table = static_cast<uint8_t>(list.size());
    list.insert(list.end(), offsets.begin(), offsets.end());
    SecretBytes trailer(32);
    trailer[6] = trailer[7] = 1;
    trailer[15] = static_cast<uint8_t>(objects.size());
    trailer[31] = table;
    list.insert(list.end(), trailer.begin(), trailer.end());
    return list;
}

TEST(PropertyList, ReadsOtherWritersForms) {
    const std::pair<std::vector<std::vector<uint8_t>>, const char*> cases[] = {
        {{{0x13, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFE}}, "i-2"},
        {{{0x12, 0xFF, 0xFF, 0xFF, 0xFE}}, "i4294967294"},
        {{{0x14, 0, 0, 0, 0, 0, 0, 0, 0, 0x7F, 0, 0, 0, 0, 0, 0, 0}}, "i9151314442816847872"},
        {{{0x14, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255}}, "i-1"},
        {{{0x22, 0x3F, 0xC0, 0, 0}}, "f3ff8000000000000"},
        {{{0x33, 0, 0, 0, 0, 0, 0, 0, 0}}, "d41cd27e440000000"},
        {{{0xA2, 1, 1}, {0x51, 'a'}}, "[ \"a\" \"a\" ]"},
        {{{0xAF, 0x10, 1, 1}, {0x00}}, "[ null ]"},
        {{{0x5F, 0x13, 0, 0, 0, 0, 0, 0, 0, 1, 'z'}}, "\"z\""},
    };
    for (const auto& [objects, text] : cases) EXPECT_EQ(readBack(listOf(objects)), text);
}

TEST(PropertyList, RefusesHostileLists) {
    const std::pair<const char*, std::vector<std::vector<uint8_t>>> cases[] = {
        {"an array within itself", {{0xA1, 0}}},
        {"a cycle through a dictionary", {{0xA1, 1}, {0xD1, 2, 0}, {0x51, 'k'}}},
        {"a wide cycle", {{0xAE, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0}}},
        {"a reference out of range", {{0xA1, 1}}},
        {"a key that is a number", {{0xD1, 1, 1}, {0x10, 1}}},
        {"a thousand million members", {{0xAF, 0x12, 0x40, 0, 0, 0, 0}}},
        {"more members than bytes", {{0xAF, 0x13, 0x7F, 255, 255, 255, 255, 255, 255, 255}}},
        {"members that wrap the size", {{0xDF, 0x13, 0x80, 0, 0, 0, 0, 0, 0, 0}}},
        {"text longer than the list", {{0x5F, 0x10, 200, 'a'}}},
        {"wide text that wraps the size", {{0x6F, 0x13, 0x80, 0, 0, 0, 0, 0, 0, 1, 0, 'a'}}},
        {"a byte count that is no integer", {{0x4F, 0x20, 1}}},
        {"eight-bit ASCII", {{0x51, 0x80}}},
        {"a lone high surrogate", {{0x61, 0xD8, 0x00}}},
        {"a lone low surrogate", {{0x61, 0xDC, 0x00}}},
        {"a high surrogate before a letter", {{0x62, 0xD8, 0x00, 0x00, 'a'}}},
        {"an integer beyond 64 bits", {{0x14, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 0, 0, 0, 0, 0}}},
        {"an integer of 32 bytes", {{0x15, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0,
                                     0,    0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0}}},
        {"a reference object", {{0x80, 1}}},
        {"a set", {{0xC0}}},
        {"an unknown marker", {{0x70}}},
    };
    for (const auto& [name, objects] : cases) EXPECT_EQ(readBack(listOf(objects)), "refused") << name;

    for (const int depth : {kMaxPropertyListDepth, kMaxPropertyListDepth + 1, 100}) {
        std::vector<std::vector<uint8_t>> chain;
        for (int i = 1; i <= depth; ++i) chain.push_back({0xA1, static_cast<uint8_t>(i)});
        chain.push_back({0x08});
        EXPECT_EQ(readBack(listOf(chain)) == "refused", depth > kMaxPropertyListDepth) << depth;
    }
    for (uint8_t length = 1; length <= 40; ++length) {
        std::vector<uint8_t> text(3 + length, 0x7F);
        text[0] = 0x5F, text[1] = 0x10, text[2] = length;
        EXPECT_NE(readBack(listOf({text})), "refused") << int{length};
        for (size_t at = 3; at < text.size(); ++at) {
            text[at] = 0x80;
            EXPECT_EQ(readBack(listOf({text})), "refused") << at << " of " << int{length};
            text[at] = 0x7F;
        }
    }
    SecretBytes strayOffset = listOf({{0x08}});
    for (const int offset : {0, 7, 9, 255}) {
        strayOffset[9] = static_cast<uint8_t>(offset);
        EXPECT_EQ(readBack(strayOffset), "refused") << offset;
    }
}

TEST(PropertyList, RefusesBadTrailers) {
    const SecretBytes sound = listOf({{0x08}});
    ASSERT_EQ(readBack(sound), "false");
    const std::tuple<const char*, size_t, uint8_t> cases[] = {
        {"no offset width", 6, 0},
        {"offsets of nine bytes", 6, 9},
        {"no reference width", 7, 0},
        {"references of nine bytes", 7, 9},
        {"more objects than offsets", 15, 2},
        {"no object", 15, 0},
        {"objects that wrap the size", 8, 0x80},
        {"top out of range", 23, 1},
        {"table in the trailer", 31, 40},
        {"table beyond the end", 24, 0x80},
    };
    for (const auto& [name, at, value] : cases) {
        SecretBytes bad = sound;
        bad[bad.size() - 32 + at] = value;
        EXPECT_EQ(readBack(bad), "refused") << name;
    }
    SecretBytes wrapping = listOf({{0xAF, 0x13, 0x20, 0, 0, 0, 0, 0, 0, 0}});
    wrapping[wrapping.size() - 32 + 7] = 8;
    EXPECT_EQ(readBack(wrapping), "refused") << "2^61 references of 8 bytes";
    SecretBytes otherFormat = sound;
    otherFormat[7] = '1';
    EXPECT_EQ(readBack(otherFormat), "refused");
}

TEST(PropertyList, SharedObjectsCannotMultiplyBeyondTheLimits) {
    // Fourteen members on each level: 7.5 million small objects, or half a million of 150 bytes.
    std::vector<uint8_t> text(150, 'x');
    text.insert(text.begin(), {0x5F, 0x10, 150});
    const std::tuple<const char*, uint8_t, std::vector<uint8_t>> cases[] = {{"objects", 6, {0x08}},
                                                                            {"payload", 5, text}};
    for (const auto& [name, levels, leaf] : cases) {
        std::vector<std::vector<uint8_t>> objects;
        for (uint8_t level = 1; level <= levels; ++level) {
            objects.emplace_back(15, level);
            objects.back().front() = 0xAE;
        }
        objects.push_back(leaf);
        EXPECT_EQ(readBack(listOf(objects)), "refused") << name;
        // One level less is within the limits: the last but one, too, then leads to the leaf.
        objects.erase(objects.end() - 2);
        EXPECT_NE(readBack(listOf(objects)), "refused") << name;
    }

    // A mebibyte of text a hundred times over: few objects, too much payload.
    const std::string megabyte(1U << 20U, 'x');
    const auto data = [&](ValueSink& sink) { sink.data(bytesOf(megabyte)); };
    EXPECT_FALSE(writeBinaryPropertyList(repeated(2, data)).empty());
    EXPECT_TRUE(writeBinaryPropertyList(repeated(65, data)).empty());
    const SecretBytes list =
        writeBinaryPropertyList(repeated(60, [&](ValueSink& sink) { sink.string(megabyte); }));
    ASSERT_LT(list.size(), 2U << 20U);
    EXPECT_NE(readBack(list), "refused");
}

}  // namespace
}  // namespace platform
