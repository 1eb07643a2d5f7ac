// Lists of both forms from another implementation, and what we write back to it.
#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <string>

#include "Platform/propertylist/PropertyList.h"
#include "TestSupport/TemporaryStateDirectory.h"

namespace platform {
namespace {

constexpr int kLists = 150;

/// Generates random values (fixed seed), writes each as a list, and later compares with what came back.
constexpr std::string_view kOtherImplementation = R"(
import datetime, plistlib, random, sys
mode, form, count = sys.argv[1], sys.argv[2], int(sys.argv[3])
xml = form == 'xml'
fmt = plistlib.FMT_XML if xml else plistlib.FMT_BINARY
rng = random.Random(7)
characters = 'ab \t\n<&>"\']' if xml else 'ab \x00\r\uffff'
def text():
    return ''.join(rng.choice(characters + '\x7f\xe9\u20ac\U0001f600') for _ in range(rng.choice((0, 3, 14, 15, 40, 300))))
def date():
    if not xml: return datetime.datetime(2001, 1, 1) + datetime.timedelta(seconds=rng.randrange(-10**9, 10**9) / 2)
    first, last = datetime.datetime.min, datetime.datetime.max.replace(microsecond=0)
    whole = datetime.timedelta(seconds=rng.randrange(int((last - first).total_seconds()) + 1))
    return rng.choice((first, last, first + whole))
def value(depth):
    kind = rng.randrange(11 if depth < 5 else 8)
    if kind == 0: return rng.choice((True, False, True if xml else None))
    if kind == 1: return rng.choice((0, 255, 256, 65535, 65536, 2**32 - 1, 2**32, 2**63 - 1, 2**63, 2**64 - 1))
    if kind == 2: return -rng.randrange(1, 2**63 + 1)
    if kind == 3: return rng.randrange(2**40)
    if kind == 4: return rng.choice((rng.uniform(-1e9, 1e9), 1e300, 5e-324, -0.0, *map(float, ('nan', 'inf', '-inf'))))
    if kind == 5: return date()
    if kind == 6: return text()
    if kind == 7: return rng.randbytes(rng.choice((0, 1, 14, 15, 300)))
    if kind == 8: return [value(depth + 1) for _ in range(rng.choice((0, 2, 14, 20)))]
    return {text(): value(depth + 1) for _ in range(rng.choice((0, 3, 9, 16)))}
for i in range(count):
    v = value(0)
    if mode == 'generate':
        with open(f'{i}.theirs', 'wb') as f: plistlib.dump(v, f, fmt=fmt, sort_keys=False)
    else:
        with open(f'{i}.ours', 'rb') as f: back = plistlib.load(f)
        if repr(back) != repr(v): sys.exit(f'{i}: {v!r} became {back!r}')
)";

void agreeOn(const std::string& form) {
    const TemporaryStateDirectory directory;
    TemporaryStateDirectory::writeFile(directory.base() / "other.py", kOtherImplementation);
    const auto runOther = [&](const std::string& mode) {
        const std::string command = "cd " + directory.base().string() + " && /usr/bin/python3 other.py " +
                                    mode + " " + form + " " + std::to_string(kLists);
        return std::system(command.c_str());
    };
    ASSERT_EQ(runOther("generate"), 0);
    for (int i = 0; i < kLists; ++i) {
        const auto path = directory.base() / std::to_string(i);
        const std::string theirs = TemporaryStateDirectory::readFile(path.string() + ".theirs");
        const auto ours = writeBinaryPropertyList(
            [&](ValueSink& sink) { EXPECT_TRUE(readPropertyList(bytesOf(theirs), sink)) << i; });
        TemporaryStateDirectory::writeFile(path.string() + ".ours", textOf(ours));
    }
    EXPECT_EQ(runOther("check"), 0);
}

TEST(PropertyList, AgreesWithAnotherImplementation) {
    if (!std::filesystem::exists("/usr/bin/python3")) GTEST_SKIP() << "no other implementation here";
    agreeOn("binary");
    agreeOn("xml");
}

}  // namespace
}  // namespace platform
