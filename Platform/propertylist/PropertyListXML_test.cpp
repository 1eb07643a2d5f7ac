#include <gtest/gtest.h>

#include <vector>

#include "Platform/propertylist/PropertyList.h"
#include "TestSupport/PropertyListCases.h"

namespace platform {
namespace {

using namespace std::literals;

std::string readBack(std::string_view document) { return readBack(bytesOf(document), readXMLPropertyList); }

std::string list(std::string_view content) { return "<plist>" + std::string(content) + "</plist>"; }
std::string listOf(const std::string& tag, const std::string& content) {
    return list("<" + tag + ">" + content + "</" + tag + ">");
}

/// What another program writes for the sample.
constexpr std::string_view kSampleDocument = R"(<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0">
<dict>
<key>booleans</key>
<array><true/><false/></array>
<key>integers</key>
<array><integer>0</integer><integer>-1</integer><integer>9223372036854775807</integer><integer>-9223372036854775808</integer><integer>18446744073709551615</integer><integer>9223372036854775808</integer></array>
<key>reals</key>
<array><real>0.1</real><real>-0</real><real>1e+300</real><real>5e-324</real><real>1.7976931348623157e+308</real><real>inf</real><real>-inf</real><real>nan</real></array>
<key>dates</key>
<array><date>1970-01-01T00:00:00Z</date><date>2014-03-05T17:04:00Z</date><date>1969-12-31T23:59:59Z</date><date>0001-01-01T00:00:00Z</date><date>9999-12-31T23:59:59Z</date></array>
<key>data</key>
<array><data></data><data>AA==</data><data>AH8=</data><data>AH+A</data><data>AH+A/g==</data><data>AH+A/v8=</data></array>
<key>texts</key>
<array><string></string><string> a	b
</string><string>&#13;
&#13;</string><string>&lt;&amp;&gt;"']]&gt;</string><string>&#x7F;&#x80;߿ࠀ�</string><string>Zoë 𐀀􏿿</string><string>&amp;amp;</string></array>
<key>Schlüssel &lt;1&gt;</key>
<dict></dict>
<key></key>
<array></array>
</dict>
</plist>
)";

TEST(XMLPropertyList, ReadsEveryKind) {
    EXPECT_EQ(readBack(kSampleDocument), written(writeSample));
    EXPECT_EQ(readBack(bytesOf(kSampleDocument), readPropertyList), written(writeSample));
    EXPECT_EQ(readBack(writeBinaryPropertyList(writeSample), readPropertyList), written(writeSample));
    const auto arrays = [](int depth) {
        std::string document = "<true/>";
        for (int i = 0; i < depth; ++i) document = "<array>" + document + "</array>";
        return list(document);
    };
    EXPECT_NE(readBack(arrays(kMaxPropertyListDepth)), "refused");
    EXPECT_EQ(readBack(arrays(kMaxPropertyListDepth + 1)), "refused");
}

TEST(XMLPropertyList, ReadsOtherWritersForms) {
    const std::string prolog =
        "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
        "<!DOCTYPE plist PUBLIC \"-//Somebody//DTD PLIST 1.0//EN\" "
        "\"http://example.com/DTDs/PropertyList-1.0.dtd\">\n";
    std::string utf16 = "\xFE\xFF";
    for (const char c : list("<string>x</string>")) utf16 += {'\0', c};
    const std::pair<std::string, const char*> cases[] = {
        {prolog + "<plist version=\"1.0\">\n<true/>\n</plist>\n", "true"},
        {"<!DOCTYPE plist SYSTEM 'plist.dtd'>" + list("<true></true>"), "true"},
        {"\xEF\xBB\xBF" + list("<false/>"), "false"},
        {utf16, "\"x\""},
        {"<?xml version='1.0' encoding='ISO-8859-1'?>" + list("<string>\xEB</string>"), "\"ë\""},
        {list("<!-- a --><?b?><string>a<!-- b -->c<![CDATA[<d>]]>&#x65;&lt;</string>"), "\"ac<d>e<\""},
        {list("<string> a\r\nb </string>"), "\" a\nb \""},
        {list("<dict x='y' ><key>k</key ><true\n/></dict>"), "{ k\"k\" true }"},
        {list("<integer> +7\n</integer>"), "i7"},
        {list("<integer>0xFFFFFFFFFFFFFFFF</integer>"), "u18446744073709551615"},
        {list("<integer>-0X10</integer>"), "i-16"},
        {list("<real> 1.5E0 </real>"), "r3ff8000000000000"},
        {list("<real>+infinity</real>"), "r7ff0000000000000"},
        {list("<date>1970-01-01T00:00:01Z</date>"), "d3ff0000000000000"},
        {list("<date>2000-02-29T00:00:00Z</date>"), "d41cc5d8600000000"},
        {list("<data>\n\tAQ ID\n\tBA==\n</data>"), "x01020304"},
        {list("<dict><key>k</key><true/><key>k</key><false/></dict>"), "{ k\"k\" true k\"k\" false }"},
    };
    for (const auto& [document, text] : cases) {
        EXPECT_EQ(readBack(document), text) << document;
        EXPECT_EQ(readBack(bytesOf(document), readPropertyList), text) << document;
    }
}

TEST(XMLPropertyList, RefusesWhatIsNoList) {
    const std::string laughs = "<!DOCTYPE plist [<!ENTITY a 'ha'><!ENTITY b '&a;&a;&a;&a;&a;&a;&a;&a;'>]>";
    std::vector<std::string> documents = {
        "",
        " ",
        "x",
        "<plist/>",
        "<true/>",
        "<dict><key>k</key></dict>",
        "<Plist><true/></Plist>",
        list(list("<true/>")),
        list("<string>a\0</string>"s),
        laughs + list("<string>&b;</string>"),
        laughs + list("<true/>"),
        "<!DOCTYPE plist [<!ELEMENT plist ANY>]>" + list("<true/>"),
        "<!DOCTYPE plist []>" + list("<true/>"),
        "<!DOCTYPE plist SYSTEM 'p.dtd'>" + list("<string>&b;</string>"),
        // Forms that are binary lists, nearly.
        "bplist00",
        "bplist00" + list("<true/>"),
    };
    for (const char* content :
         {"", "<true/><true/>", "x<true/>", "<true/>x", "<array>", "<array></dict>", "<null/>", "<True/>",
          "<string><true/></string>", "<true><true/></true>", "<true>x</true>", "<key>k</key>",
          "<array>x</array>", "<array><key>k</key></array>", "<dict><true/></dict>",
          "<dict><key>k</key></dict>", "<dict><key>k</key><key>l</key><true/></dict>",
          "<dict><key>k</key><true/><true/></dict>"})
        documents.push_back(list(content));
    const std::pair<std::string, std::vector<const char*>> scalars[] = {
        {"integer", {"", "-", "--1", "+-1", "0x", "1 2", "1.0", "F"}},
        {"integer", {"18446744073709551616", "-9223372036854775809", "0x10000000000000000"}},
        {"real", {"", "1,5", "1.5x", "+-1", "nan(1)", "1e999", "0x1p3"}},
        {"date", {"", "2014-03-05T17:04:00", "2014-03-05T17:04:00+0000", "2014-03-05T17:04:60Z"}},
        {"date", {"2014-03-05T24:00:00Z", "2014-02-29T00:00:00Z", "2014-13-01T00:00:00Z"}},
        {"date", {"0000-01-01T00:00:00Z", "+014-03-05T17:04:00Z"}},
        {"data", {"A", "AQ", "AQI", "AQ=", "AQ==AQ==", "AQ===", "====", "A*I=", "AQI-"}},
        {"string", {"\x80", "\xC0\xAF", "\xED\xA0\x80", "\x01", "\uFFFF", "&#0;", "]]>", "&b;"}},
    };
    for (const auto& [tag, contents] : scalars)
        for (const char* content : contents) documents.push_back(listOf(tag, content));
    for (const std::string& document : documents) {
        EXPECT_EQ(readBack(document), "refused") << document;
        EXPECT_EQ(readBack(bytesOf(document), readPropertyList), "refused") << document;
    }
}

TEST(XMLPropertyList, RefusesWhatGoesOverTheLimits) {
    const auto times = [](size_t count, std::string_view text) {
        std::string repeated;
        for (; count > 0; --count) repeated += text;
        return list("<array>" + repeated + "</array>");
    };
    // The array itself is an object, too.
    EXPECT_EQ(readBack(times(kMaxPropertyListObjects, "<true/>")), "refused");
    const std::string quarter(kMaxPropertyListPayload / 4, 'x');
    EXPECT_NE(readBack(times(4, "<string>" + quarter + "</string>")), "refused");
    EXPECT_EQ(readBack(times(4, "<string>" + quarter + "</string><string>x</string>")), "refused");
    EXPECT_EQ(readBack(list("<data>" + std::string(2 * kMaxPropertyListPayload + 1, ' ') + "</data>")),
              "refused");
}

TEST(XMLPropertyList, DamagedDocumentsAreRefusedOrAreOtherLists) {
    const std::string sound(kSampleDocument);
    const size_t end = sound.rfind('>');
    for (size_t size = 0; size <= end; ++size) {
        // A copy of exactly this size, so that reading beyond it is seen.
        const std::vector<char> cut(sound.begin(), sound.begin() + static_cast<ptrdiff_t>(size));
        ASSERT_EQ(readBack({cut.data(), cut.size()}), "refused") << size;
    }
    for (size_t at = 0; at < sound.size(); ++at) {
        for (unsigned bit = 0; bit < 8; ++bit) {
            std::string flipped = sound;
            flipped[at] = static_cast<char>(flipped[at] ^ (1 << bit));
            const std::string text = readBack(flipped);
            if (text == "refused") continue;
            const auto again = writeBinaryPropertyList(
                [&](ValueSink& sink) { readXMLPropertyList(bytesOf(flipped), sink); });
            ASSERT_EQ(readBack(again, readBinaryPropertyList), text) << flipped;
        }
    }
}

}  // namespace
}  // namespace platform
