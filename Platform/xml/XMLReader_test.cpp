#include "Platform/xml/XMLReader.h"

#include <gtest/gtest.h>

#include <functional>
#include <stdexcept>

namespace platform {
namespace {

using namespace std::literals;

/// Writes what it receives as one line; pieces of one text come together.
class Recorder : public XMLEvents {
  public:
    void startElement(std::string_view name) override { trace += "<" + std::string(name) + ">"; }
    void endElement(std::string_view name) override { trace += "</" + std::string(name) + ">"; }
    void characters(std::string_view text) override { trace += text; }

    std::string trace;
};

std::string utf16(std::string_view ascii) {
    std::string encoded = "\xFF\xFE";
    for (const char c : ascii) encoded += {c, '\0'};
    return encoded;
}

/// What it is, its text, and the trace that it leaves.
using Document = std::tuple<const char*, std::string, std::string>;

TEST(XMLReader, DeliversElementsAndTextFreedOfMarkup) {
    const Document documents[] = {
        {"nesting and attributes", "<a x='1'>t<b/>u</a>", "<a>t<b></b>u</a>"},
        {"predefined entities", "<a>&lt;&amp;&gt;&quot;&apos;</a>", "<a><&>\"'</a>"},
        {"character references", "<a>&#x27;&#233;&#x1F600;</a>", "<a>'\u00E9\U0001F600</a>"},
        {"CDATA", "<a><![CDATA[<b>&amp;]]></a>", "<a><b>&amp;</a>"},
        {"comments and instructions", "<?xml version='1.0'?><!-- x --><a><?p i?>1<!-- y -->2</a>",
         "<a>12</a>"},
        {"line ends", "<a>\r\n\r</a>", "<a>\n\n</a>"},
        {"prefixes stay", "<n:a xmlns:n='u'/>", "<n:a></n:a>"},
        {"another encoding", "<?xml version='1.0' encoding='ISO-8859-1'?><a>\xE9</a>", "<a>\u00E9</a>"},
        {"a byte-order mark", utf16("<a>x</a>"), "<a>x</a>"},
        {"a document type without entities", "<!DOCTYPE a [<!ELEMENT a ANY>]><a>x</a>", "<a>x</a>"},
        {"a document type elsewhere", "<!DOCTYPE a SYSTEM 'file:///etc/passwd'><a>x</a>", "<a>x</a>"},
    };
    for (const auto& [what, text, trace] : documents) {
        Recorder recorder;
        XMLReader reader(bytesOf(text));
        EXPECT_TRUE(reader.read(recorder)) << what;
        EXPECT_EQ(recorder.trace, trace) << what;
        EXPECT_FALSE(reader.error()) << what;
    }
}

TEST(XMLReader, RefusesWhatIsNotWellFormedOrDeclaresEntities) {
    const Document documents[] = {
        {"nothing", "", ""},
        {"only white space", " \n", ""},
        {"a missing end", "<a><b></b>", "<a><b></b>"},
        {"a wrong end", "<a></b>", "<a>"},
        {"a tail", "<a/>x", "<a></a>"},
        {"bytes that are not UTF-8", "<a>\xFF</a>", "<a>"},
        {"a zero byte", "<a>\0</a>"s, "<a>"},
        {"an entity that nobody declared", "<a>&x;</a>", "<a>"},
        {"an entity, even an unused one", "<!DOCTYPE a [<!ENTITY x 'y'>]><a/>", ""},
        {"an external entity", "<!DOCTYPE a [<!ENTITY x SYSTEM 'file:///etc/passwd'>]><a>&x;</a>", ""},
        {"a parameter entity", "<!DOCTYPE a [<!ENTITY % p 'q'>]><a/>", ""},
        {"a parameter entity of nobody", "<!DOCTYPE a [%p; <!ENTITY x 'y'>]><a/>", ""},
        {"an entity that a type elsewhere may have", "<!DOCTYPE a SYSTEM 'a.dtd'><a>1&x;2</a>", "<a>1"},
        {"laughs",
         "<!DOCTYPE a [<!ENTITY l 'lol'><!ENTITY m '&l;&l;&l;&l;&l;'><!ENTITY n '&m;&m;&m;&m;'>]><a>&n;</a>",
         ""},
    };
    for (const auto& [what, text, trace] : documents) {
        Recorder recorder;
        XMLReader reader(bytesOf(text));
        EXPECT_FALSE(reader.read(recorder)) << what;
        EXPECT_EQ(recorder.trace, trace) << what;
        EXPECT_FALSE(reader.error().value().description.empty()) << what;
    }
}

TEST(XMLReader, TellsWhereTheDocumentBroke) {
    Recorder recorder;
    XMLReader reader(bytesOf("<a>\n<b>\n</c></a>"));
    ASSERT_FALSE(reader.read(recorder));
    EXPECT_EQ(reader.error()->line, 3U);
    EXPECT_EQ(reader.error()->byteOffset, 10U);
}

/// Stops at the start of "stop", in the way that it is given.
class Stopper : public Recorder {
  public:
    explicit Stopper(std::function<void()> stop) : stop_(std::move(stop)) {}
    void startElement(std::string_view name) override {
        Recorder::startElement(name);
        if (name == "stop") stop_();
    }

  private:
    std::function<void()> stop_;
};

TEST(XMLReader, DeliversNothingAfterAnEventEndedTheReading) {
    const std::string document = "<a>1<stop/>2<b/></a>";
    XMLReader reader(bytesOf(document));
    const std::function<void()> ways[] = {[&] { reader.abort(); },
                                          [] { throw std::runtime_error("from an event"); }};
    for (const auto& way : ways) {
        Stopper stopper(way);
        EXPECT_FALSE(reader.read(stopper));
        EXPECT_EQ(stopper.trace, "<a>1<stop>");
        EXPECT_TRUE(reader.error());
    }

    Recorder undisturbed;
    EXPECT_TRUE(reader.read(undisturbed)) << "an ended reading must not spoil the next one";
    EXPECT_FALSE(reader.error());
}

TEST(XMLReader, ReadsDocumentsLargerThanOnePieceWholly) {
    // Names, references and characters of several bytes come to lie across every kind of piece boundary.
    std::string document = "<long-root-name>";
    std::string trace = document;
    for (int i = 0; i < 40'000; ++i) {
        const std::string number = std::to_string(i);
        document += "<e" + number + ">&lt;\u20AC</e" + number + ">";
        trace += "<e" + number + "><\u20AC</e" + number + ">";
    }
    document += "</long-root-name>";
    trace += "</long-root-name>";
    Recorder recorder;
    XMLReader reader(bytesOf(document));
    ASSERT_TRUE(reader.read(recorder)) << reader.error()->description;
    EXPECT_TRUE(recorder.trace == trace);
}

}  // namespace
}  // namespace platform
