#include "platform/foundation/TypeDatabase.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <bit>
#include <vector>

#include "platform/foundation/DataDirectories.h"
#include "platform/foundation/MimeGlobs.h"
#include "platform/foundation/MimeMagic.h"
#include "support/TemporaryFolder.h"

namespace cindral {
namespace {

/// Data directories of the test's own, the most important first, and the database made of them.
class TypeDatabaseTest : public ::testing::Test {
protected:
    void globs(const std::string& lines, const std::string& directory = "user") { write(directory, "globs2", lines); }
    void aliases(const std::string& lines) { write("user", "aliases", lines); }
    void subclasses(const std::string& lines) { write("user", "subclasses", lines); }
    void magic(const std::string& sections, const std::string& directory = "user") {
        write(directory, "magic", std::string("MIME-Magic\0\n", 12) + sections);
    }
    void write(const std::string& directory, const std::string& file, const std::string& contents) {
        folder_.file(directory + "/mime/" + file, contents);
        database_.reset();
    }

    const TypeDatabase& database() {
        if (!database_) {
            const std::vector<std::string> directories{folder_ / "user", folder_ / "system"};
            database_ = TypeDatabase::load(directories, TypeDatabase::builtInDeclarations());
        }
        return *database_;
    }
    std::string ofName(std::string_view name) { return database().typeOfName(name).string(); }
    std::string ofContents(std::string_view contents) { return database().typeOfContents(bytesOf(contents)).string(); }
    std::string ofFile(std::string_view name, const std::string& contents) {
        return database()
            .typeOf(S_IFREG | 0644, name, contents.size(),
                    [&](std::size_t count) {
                        const ByteView bytes = bytesOf(contents).first(std::min(count, contents.size()));
                        return Bytes(bytes.begin(), bytes.end());
                    })
            .string();
    }
    std::string ofKind(mode_t kind, std::string_view name) {
        const auto refuse = [](std::size_t) -> std::optional<Bytes> {
            ADD_FAILURE() << "only a regular file's contents may be looked at";
            return std::nullopt;
        };
        return database().typeOf(kind | 0755, name, 4096, refuse).string();
    }

    test::TemporaryFolder folder_;
    std::unique_ptr<TypeDatabase> database_;
};

std::string section(int priority, const std::string& type) {
    return "[" + std::to_string(priority) + ":" + type + "]\n";
}

/// A line of a magic file: `head` is "[indent]>offset", `tail` what follows the value.
std::string rule(const std::string& head, const std::string& value, const std::string& tail = "") {
    return head + "=" + static_cast<char>(value.size() >> 8U) + static_cast<char>(value.size() & 0xffU) + value + tail +
           "\n";
}

// Names.

TEST_F(TypeDatabaseTest, knowsASuffixAndAWholeName) {
    globs("50:text/plain:*.txt\n50:text/x-makefile:makefile\n");
    EXPECT_EQ(ofName("letter.txt"), "text/plain");
    EXPECT_EQ(ofName(".txt"), "text/plain");
    EXPECT_EQ(ofName("makefile"), "text/x-makefile");
    EXPECT_EQ(ofName("Makefile"), "text/x-makefile");
    EXPECT_EQ(ofName("makefile2"), "");
    EXPECT_EQ(ofName("txt"), "");
    EXPECT_EQ(ofName("letter.txt."), "");
    EXPECT_EQ(ofName(""), "");
}

TEST_F(TypeDatabaseTest, prefersTheLongestSuffix) {
    globs("50:application/gzip:*.gz\n50:application/x-compressed-tar:*.tar.gz\n50:application/x-tar:*.tar\n");
    EXPECT_EQ(ofName("a.tar.gz"), "application/x-compressed-tar");
    EXPECT_EQ(ofName("a.b.gz"), "application/gzip");
    EXPECT_EQ(ofName("a.tar"), "application/x-tar");
}

TEST_F(TypeDatabaseTest, prefersTheHigherWeightToTheLongerPattern) {
    globs(
        "60:application/gzip:*.gz\n50:application/x-compressed-tar:*.tar.gz\n10:text/x-readme:readme*\n50:text/"
        "html:*.html\n");
    EXPECT_EQ(ofName("a.tar.gz"), "application/gzip");
    EXPECT_EQ(ofName("readme.html"), "text/html");
    EXPECT_EQ(ofName("readme.unknown"), "text/x-readme");
}

TEST_F(TypeDatabaseTest, prefersAWholeNameToAPatternOfItsWeight) {
    globs("50:text/x-a:*.txt\n50:text/x-b:notes.txt\n50:text/x-c:notes.*\n50:text/x-d:*notes.txt\n");
    EXPECT_EQ(ofName("notes.txt"), "text/x-b");
    EXPECT_EQ(ofName("Notes.txt"), "text/x-b");  // Whatever its case: not "*.txt", which it matches as it is.
    EXPECT_EQ(ofName("my notes.txt"), "text/x-d");
    EXPECT_EQ(ofName("notes.md"), "text/x-c");
}

TEST_F(TypeDatabaseTest, matchesOtherPatternsWithWildcards) {
    globs(
        "50:application/x-troff-man:*.[1-9]\n50:application/x-trash:*~\n50:video/mpeg:[0-9][0-9][0-9].vdr\n"
        "60:application/x-sharedlib:*.so.[0-9]*\n50:application/gzip:*.gz\n50:text/x-odd:?[!a-c]\\**\n");
    EXPECT_EQ(ofName("ls.1"), "application/x-troff-man");
    EXPECT_EQ(ofName("ls.0"), "");
    EXPECT_EQ(ofName("letter.txt~"), "application/x-trash");
    EXPECT_EQ(ofName("001.vdr"), "video/mpeg");
    EXPECT_EQ(ofName("1.vdr"), "");
    EXPECT_EQ(ofName("libc.so.6"), "application/x-sharedlib");
    EXPECT_EQ(ofName("libc.so.6.gz"), "application/x-sharedlib");
    EXPECT_EQ(ofName("xd*"), "text/x-odd");
    EXPECT_EQ(ofName("xd*z"), "text/x-odd");
    EXPECT_EQ(ofName("xa*"), "");
    EXPECT_EQ(ofName("xdz"), "");
}

TEST_F(TypeDatabaseTest, triesTheNameAsItIsBeforeItsLowerCase) {
    globs(
        "50:text/x-c++src:*.C:cs\n50:text/x-csrc:*.c:cs\n50:image/gif:*.gif\n50:application/x-core:core:cs\n50:text/"
        "x-man:*.[X-Z]\n");
    EXPECT_EQ(ofName("main.C"), "text/x-c++src");
    EXPECT_EQ(ofName("main.c"), "text/x-csrc");
    EXPECT_EQ(ofName("IMAGE.GIF"), "image/gif");
    EXPECT_EQ(ofName("image.GiF"), "image/gif");
    EXPECT_EQ(ofName("core"), "application/x-core");
    EXPECT_EQ(ofName("Core"), "");
    EXPECT_EQ(ofName("x.y"), "text/x-man");  // Without the flag, case says nothing in a pattern either.
}

TEST_F(TypeDatabaseTest, keepsCaseInsistentAndOtherPatternsOfOneTextApart) {
    globs("80:text/x-strict:*.doc:cs\n50:text/x-lax:*.doc\n80:text/x-strict:readme:other,cs\n50:text/x-lax:readme\n");
    EXPECT_EQ(ofName("a.doc"), "text/x-strict");
    EXPECT_EQ(ofName("a.DOC"), "text/x-lax");
    EXPECT_EQ(ofName("readme"), "text/x-strict");
    EXPECT_EQ(ofName("README"), "text/x-lax");
}

// The installed files repeat every pattern that has flags, for readers that know none.
TEST_F(TypeDatabaseTest, takesAPatternRepeatedWithoutItsFlagForOne) {
    globs(
        "50:text/x-c++src:*.C:cs\n50:text/x-c++src:*.C\n50:text/x-other:*.C\n50:application/"
        "x-core:core:cs\n50:application/x-core:core\n");
    EXPECT_EQ(ofName("a.C"), "text/x-c++src");
    EXPECT_EQ(ofName("a.c"), "text/x-other");
    EXPECT_EQ(ofName("core"), "application/x-core");
    EXPECT_EQ(ofName("CORE"), "");
}

TEST_F(TypeDatabaseTest, takesNamesOfAnyBytesAndLength) {
    globs("50:text/plain:*.txt\n50:text/x-tilde:*~\n");
    EXPECT_EQ(ofName("\xff\xfe\n.txt"), "text/plain");
    EXPECT_EQ(ofName("\xff~"), "text/x-tilde");
    EXPECT_EQ(ofName(std::string(100'000, 'A') + ".TXT"), "text/plain");
    EXPECT_EQ(ofName(std::string(100'000, '.') + "txt"), "text/plain");
}

TEST_F(TypeDatabaseTest, breaksTiesByFileThenByTypeName) {
    globs("50:text/x-system:*.one\n50:text/x-b:*.two\n50:text/x-a:*.two\n50:text/x-b:*.[3]\n50:text/x-a:*.[3]\n",
          "system");
    globs("50:text/x-user:*.one\n");
    EXPECT_EQ(ofName("a.one"), "text/x-user");
    EXPECT_EQ(ofName("a.two"), "text/x-a");
    EXPECT_EQ(ofName("a.3"), "text/x-a");
}

TEST_F(TypeDatabaseTest, discardsGlobsOfLessImportantDirectoriesOnRequest) {
    globs("50:text/x-a:*.old\n50:text/x-a:*.old[0-9]\n50:text/x-b:*.kept\n", "system");
    globs("0:text/x-a:__NOGLOBS__\n50:text/x-a:*.new\n");
    EXPECT_EQ(ofName("x.new"), "text/x-a");
    EXPECT_EQ(ofName("x.old"), "");
    EXPECT_EQ(ofName("x.old1"), "");
    EXPECT_EQ(ofName("x.kept"), "text/x-b");
    EXPECT_EQ(ofName("__NOGLOBS__"), "");
}

TEST_F(TypeDatabaseTest, keepsGlobsOfMoreImportantDirectories) {
    globs("0:text/x-a:__NOGLOBS__\n", "system");
    globs("50:text/x-a:*.new\n");
    EXPECT_EQ(ofName("x.new"), "text/x-a");
}

TEST_F(TypeDatabaseTest, passesOverMalformedLines) {
    globs(
        "# "
        "50:text/x-comment:*.a\n\n50\n50:text/plain\n50:text/plain:\n:text/plain:*.a\n-1:text/plain:*.a\n101:text/"
        "plain:*.a\n"
        "99999999999999999999:text/plain:*.a\n5 "
        "0:text/plain:*.a\n50:plain:*.a\n50:text/:*.a\n50:/plain:*.a\n50:a/b/c:*.a\n"
        "50:te xt/plain:*.a\n50:text/x-good:*.good");
    EXPECT_EQ(ofName("x.a"), "");
    EXPECT_EQ(ofName("x.good"), "text/x-good");
}

TEST_F(TypeDatabaseTest, choosesAmongMoreThanOneGroupOfPatterns) {
    std::string lines;
    for (int i = 0; i < 200; ++i) lines += "50:text/x-" + std::to_string(i) + ":*-" + std::to_string(i) + "[a-z]\n";
    globs(lines);
    for (int i = 0; i < 200; ++i) EXPECT_EQ(ofName("file-" + std::to_string(i) + "q"), "text/x-" + std::to_string(i));
    EXPECT_EQ(ofName("file-200q"), "");
}

TEST_F(TypeDatabaseTest, givesTypesTheirCanonicalName) {
    aliases("text/xml application/xml\n");
    globs("50:text/xml:*.xml\n");
    magic(section(50, "text/xml") + rule(">0", "<?xml"));
    EXPECT_EQ(ofName("a.xml"), "application/xml");
    EXPECT_EQ(ofContents("<?xml version"), "application/xml");
}

struct GlobCase {
    std::string_view pattern, text;
    bool matches;
};

TEST(MatchesGlob, goesByBytes) {
    const GlobCase cases[] = {
        {"*", "", true},
        {"", "", true},
        {"", "a", false},
        {"a*b*c", "aXbXbXc", true},
        {"a*b*c", "aXbXbX", false},
        {"*a", "bab", false},
        {"*ab", "aab", true},
        {"[]a]", "]", true},
        {"[!]a]", "]", false},
        {"[!]a]", "b", true},
        {"[a-", "[a-", true},
        {"[a-]", "-", true},
        {"[z-a]", "m", false},
        {"\\*", "*", true},
        {"\\*", "a", false},
        {"\\", "\\", true},
        {"?", "\xff", true},
        {"[\x80-\xff]", "\xc3", true},
        {"?", "", false},
        {"**a**", "a", true},
        {"[", "[", true},
        {"[!", "[!", true},
        {"[!]", "[!]", true},
        {"[^a]", "b", true},
    };
    for (const auto& [pattern, text, matches] : cases)
        EXPECT_EQ(matchesGlob(pattern, text), matches) << pattern << " " << text;
}

// Contents.

TEST_F(TypeDatabaseTest, looksAtContentsOnlyWhenTheNameSaysNothing) {
    globs("50:text/plain:*.txt\n");
    magic(section(50, "image/png") + rule(">0", "\x89PNG"));
    EXPECT_EQ(ofFile("picture", "\x89PNG etc"), "image/png");
    EXPECT_EQ(ofFile("picture.txt", "\x89PNG etc"), "text/plain");
    EXPECT_EQ(ofFile("picture.what", "\x89PNG etc"), "image/png");
    EXPECT_EQ(ofContents("etc"), "");
}

TEST_F(TypeDatabaseTest, asksForNoMoreThanItCanUse) {
    magic(section(50, "text/x-far") + rule(">5000", "far", "+10"));
    EXPECT_EQ(database().contentBytesMax(), 5012U);
    std::size_t asked = 0;
    database().typeOf(S_IFREG, "x", 100'000, [&](std::size_t count) {
        asked = count;
        return Bytes(1);
    });
    EXPECT_EQ(asked, 5012U);
}

TEST_F(TypeDatabaseTest, triesAnOffsetRange) {
    magic(section(50, "text/x-a") + rule(">2", "ab", "+3"));
    EXPECT_EQ(ofContents("01ab"), "text/x-a");
    EXPECT_EQ(ofContents("0123ab"), "text/x-a");
    EXPECT_EQ(ofContents("01234ab"), "");
    EXPECT_EQ(ofContents("0ab"), "");
    EXPECT_EQ(ofContents("0123a"), "");
}

TEST_F(TypeDatabaseTest, appliesAMask) {
    magic(section(50, "text/x-a") + rule(">0", "A\x10", std::string("&\xdf\xf0", 3)));
    EXPECT_EQ(ofContents("a\x1f"), "text/x-a");
    EXPECT_EQ(ofContents("A\x10"), "text/x-a");
    EXPECT_EQ(ofContents("A\x20"), "");
}

TEST_F(TypeDatabaseTest, readsWordsAsTheMachineWritesThem) {
    magic(section(50, "text/x-two") + rule(">0", "\x01\x02\x03\x04", "~2") +  //
          section(50, "text/x-four") + rule(">0", "\x0a\x0b\x0c\x0d", "&\xff\xff\xff\xf0~4"));
    const bool isLittle = std::endian::native == std::endian::little;
    EXPECT_EQ(ofContents(isLittle ? "\x02\x01\x04\x03" : "\x01\x02\x03\x04"), "text/x-two");
    EXPECT_EQ(ofContents(isLittle ? "\x04\x03\x02\x01" : "\x02\x01\x04\x03"), "");
    EXPECT_EQ(ofContents(isLittle ? "\x0f\x0c\x0b\x0a" : "\x0a\x0b\x0c\x0f"), "text/x-four");
    EXPECT_EQ(ofContents(isLittle ? "\x0d\x0c\x0b\x0f" : "\x0f\x0b\x0c\x0d"), "");
}

TEST_F(TypeDatabaseTest, needsOneOfTheRulesBelowToMatchToo) {
    magic(section(50, "text/x-a") + rule(">0", "A") + rule("1>1", "B") + rule("2>2", "C") + rule("1>1", "D") +
          rule(">0", "E"));
    EXPECT_EQ(ofContents("ABC"), "text/x-a");
    EXPECT_EQ(ofContents("AD"), "text/x-a");
    EXPECT_EQ(ofContents("E"), "text/x-a");
    EXPECT_EQ(ofContents("ABX"), "");
    EXPECT_EQ(ofContents("A"), "");
    EXPECT_EQ(ofContents("XBC"), "");
}

TEST_F(TypeDatabaseTest, triesSectionsByPriorityThenImportance) {
    magic(section(40, "text/x-low") + rule(">0", "A") + section(60, "text/x-high") + rule(">0", "AB"));
    magic(section(60, "text/x-system") + rule(">0", "A") + section(90, "text/x-top") + rule(">0", "ABC"), "system");
    EXPECT_EQ(ofContents("ABC"), "text/x-top");
    EXPECT_EQ(ofContents("ABX"), "text/x-high");
    EXPECT_EQ(ofContents("AXX"), "text/x-system");
}

TEST_F(TypeDatabaseTest, discardsMagicOfLessImportantDirectoriesOnRequest) {
    magic(section(50, "text/x-a") + rule(">0", "old") + section(50, "text/x-b") + rule(">0", "kept"), "system");
    magic(section(0, "text/x-a") + rule(">0", "__NOMAGIC__") + section(50, "text/x-a") + rule(">0", "new"));
    EXPECT_EQ(ofContents("new"), "text/x-a");
    EXPECT_EQ(ofContents("old"), "");
    EXPECT_EQ(ofContents("kept"), "text/x-b");
    EXPECT_EQ(ofContents("__NOMAGIC__"), "");
}

// A rule that can't be read never makes its neighbours match more than they say.
TEST_F(TypeDatabaseTest, passesOverMalformedRulesWithWhatIsBelow) {
    const std::string last = section(10, "text/x-last") + rule(">0", "Z");
    const std::string unusable[] = {
        rule("1>1", "B", "?"),  rule("1>1", "BBB", "~2"), rule("1>1", "B", "~0"),
        rule("1>1", "B", "+0"), rule("1>65536", "B"),     rule("1>1", "B", "+99999999999999999999"),
        rule("1>1", ""),        rule("1>", "B"),          std::string("1>1\n"),
        std::string("1\n"),
    };
    for (const auto& line : unusable) {
        magic(section(50, "text/x-a") + rule(">0", "A") + line + rule("2>2", "C") + rule(">0", "E") + last);
        EXPECT_EQ(ofContents("ABC"), "") << line;
        EXPECT_EQ(ofContents("XXC"), "") << line;
        EXPECT_EQ(ofContents("E"), "text/x-a") << line;
        EXPECT_EQ(ofContents("Z"), "text/x-last") << line;
    }
}

TEST_F(TypeDatabaseTest, passesOverMalformedSections) {
    for (const std::string head :
         {"[50:text]\n", "[:text/x-a]\n", "[text/x-a]\n", "[101:text/x-a]\n", "[50:text/x-a\n", "[\n", "x\n"}) {
        magic(head + rule(">0", "A") + section(10, "text/x-last") + rule(">0", "Z"));
        EXPECT_EQ(ofContents("A"), "") << head;
        EXPECT_EQ(ofContents("Z"), "text/x-last") << head;
    }
}

TEST_F(TypeDatabaseTest, ignoresAMagicFileOfAnotherKind) {
    write("user", "magic", section(50, "text/x-a") + rule(">0", "A"));
    EXPECT_EQ(ofContents("A"), "");
}

TEST(MimeMagic, readsEveryTruncation) {
    const std::string whole = std::string("MIME-Magic\0\n", 12) + section(60, "text/x-a") +
                              rule(">0", "A\nB", "&\xff\xff\xff") + rule("1>3", "CD", "~2+5") +
                              section(50, "text/x-b") + rule(">1", "Q");
    const ByteView bytes = bytesOf(whole);
    for (std::size_t length = 0; length <= whole.size(); ++length) {
        // A copy of its own, so that reading on behind it is noticed.
        const Bytes cut(bytes.begin(), bytes.begin() + static_cast<std::ptrdiff_t>(length));
        MimeTypes types;
        MimeMagic magic;
        magic.add(cut, types);
        const auto second = magic.find(bytesOf("?Q"));
        EXPECT_EQ(second.has_value(), length == whole.size()) << length;
        if (second) {
            EXPECT_EQ(types.name(*second), "text/x-b");
        }
        const auto first = magic.find(bytesOf(std::endian::native == std::endian::little ? "A\nBDC" : "A\nBCD"));
        if (length >= whole.size() - section(50, "text/x-b").size() - rule(">1", "Q").size()) {
            ASSERT_TRUE(first) << length;
            EXPECT_EQ(types.name(*first), "text/x-a");
        }
    }
}

TEST(MimeMagic, survivesEveryFlippedBit) {
    const std::string whole = std::string("MIME-Magic\0\n", 12) + section(60, "text/x-a") +
                              rule(">0", "AB", "&\xff\xff") + rule("1>3", "CD", "~2+5") + section(50, "text/x-b") +
                              rule(">1", "Q");
    std::size_t stillFound = 0;
    for (std::size_t bit = 0; bit < whole.size() * 8; ++bit) {
        std::string changed = whole;
        changed[bit / 8] = static_cast<char>(changed[bit / 8] ^ (1 << (bit % 8)));
        MimeTypes types;
        MimeMagic magic;
        magic.add(bytesOf(changed), types);
        EXPECT_LE(magic.contentBytesMax(), MimeMagic::kContentBytesMax);
        stillFound += magic.find(bytesOf("?Q")).has_value() ? 1 : 0;
    }
    EXPECT_GT(stillFound, 0U);                // A flip in the first section leaves the second.
    EXPECT_LT(stillFound, whole.size() * 8);  // One in the second is noticed.
}

TEST_F(TypeDatabaseTest, tellsTextFromBytes) {
    EXPECT_EQ(ofFile("x", "Hello,\n\tworld\r\n"), "text/plain");
    EXPECT_EQ(ofFile("x",
                     "Gr\xc3\xbc\xc3\x9f"
                     "e"),
              "text/plain");
    EXPECT_EQ(ofFile("x", "a caf\xe9 in an older encoding"), "text/plain");
    EXPECT_EQ(ofFile("x", std::string("nul\0nul", 7)), "application/octet-stream");
    EXPECT_EQ(ofFile("x", "\x01 control"), "application/octet-stream");
    EXPECT_EQ(ofFile("x", "\xfe\xdc\xba\x98"), "application/octet-stream");
    // A character that the reading cut in two is no reason against text; the first that is left out doesn't count.
    EXPECT_EQ(ofFile("x", std::string(1023, ' ') + "\xc3\xbc"), "text/plain");
    EXPECT_EQ(ofFile("x", std::string(1024, ' ') + std::string(1, '\0')), "text/plain");
}

TEST_F(TypeDatabaseTest, knowsAnEmptyFileByItsName) {
    globs("50:text/plain:*.txt\n");
    EXPECT_EQ(ofFile("x.txt", ""), "text/plain");
    EXPECT_EQ(ofFile("x", ""), "application/x-zerosize");
}

TEST_F(TypeDatabaseTest, isOctetStreamWhenContentsCannotBeRead) {
    const auto unreadable = [](std::size_t) -> std::optional<Bytes> { return std::nullopt; };
    EXPECT_EQ(database().typeOf(S_IFREG, "x", 10, unreadable).string(), "application/octet-stream");
    EXPECT_EQ(database().typeOf(S_IFREG, "x", 10, nullptr).string(), "application/octet-stream");
    EXPECT_EQ(database().typeOf(S_IFREG, "x", 10, [](std::size_t) { return Bytes(); }).string(),
              "application/x-zerosize");
}

// Kinds and declared types.

TEST_F(TypeDatabaseTest, goesByKindForAllButRegularFiles) {
    globs("50:text/plain:*.txt\n");
    EXPECT_EQ(ofKind(S_IFDIR, "a.txt"), "inode/directory");
    EXPECT_EQ(ofKind(S_IFLNK, "a.txt"), "inode/symlink");
    EXPECT_EQ(ofKind(S_IFIFO, "a.txt"), "inode/fifo");
    EXPECT_EQ(ofKind(S_IFSOCK, "a.txt"), "inode/socket");
    EXPECT_EQ(ofKind(S_IFCHR, "a.txt"), "inode/chardevice");
    EXPECT_EQ(ofKind(S_IFBLK, "a.txt"), "inode/blockdevice");
}

TEST_F(TypeDatabaseTest, knowsPackagesByExtension) {
    EXPECT_EQ(ofKind(S_IFDIR, "Plan.folio"), "com.vemra.folio.document");
    EXPECT_EQ(ofKind(S_IFDIR, "Song.v2.ToneMill"), "com.vemra.tonemill.project");
    EXPECT_TRUE(database().isPackageName("Plan.FOLIO"));
    EXPECT_TRUE(database().isPackageName("a.tonemill"));
    for (const std::string_view name :
         {"folio", ".folio", "Plan.folio.d", "Plan.folio2", "Plan.", "", "com.vemra.package"}) {
        EXPECT_FALSE(database().isPackageName(name)) << name;
        EXPECT_EQ(ofKind(S_IFDIR, name), "inode/directory") << name;
    }
}

TEST_F(TypeDatabaseTest, takesARegularFileNamedLikeAPackageForWhatItHolds) {
    EXPECT_EQ(ofFile("Plan.folio", "words"), "text/plain");
    EXPECT_EQ(ofFile("Plan.folio", ""), "application/x-zerosize");
    EXPECT_EQ(ofName("Plan.folio"), "");
    EXPECT_EQ(ofKind(S_IFLNK, "Plan.folio"), "inode/symlink");
}

TEST_F(TypeDatabaseTest, takesDeclarationsThatAreNoPackages) {
    const TypeDatabase::Declaration declared[] = {{"album", "org.example.album", "inode/directory"},
                                                  {"bare", "org.example.bare", ""}};
    const auto database = TypeDatabase::load({}, declared);
    EXPECT_EQ(database->typeOf(S_IFDIR, "Holiday.album", 0, nullptr).string(), "org.example.album");
    EXPECT_EQ(database->typeOf(S_IFDIR, "Holiday.bare", 0, nullptr).string(), "org.example.bare");
    EXPECT_FALSE(database->isPackageName("Holiday.album"));
    EXPECT_FALSE(database->isPackageName("Holiday.bare"));
    EXPECT_TRUE(database->conforms("org.example.album", "inode/directory"));
}

TEST_F(TypeDatabaseTest, fingerprintsTheSetOfDeclarations) {
    const TypeDatabase::Declaration a{"a", "org.example.a", "com.vemra.package"};
    const TypeDatabase::Declaration b{"b", "org.example.b", "com.vemra.package"};
    const auto fingerprint = [](std::vector<TypeDatabase::Declaration> declared) {
        return TypeDatabase::load({}, declared)->declarationsFingerprint();
    };
    EXPECT_EQ(fingerprint({a, b}), fingerprint({b, a}));
    EXPECT_EQ(fingerprint({a}), fingerprint({{"A", a.identifier, a.conformsTo}}));
    EXPECT_NE(fingerprint({a}), fingerprint({a, b}));
    EXPECT_NE(fingerprint({a}), fingerprint({}));
    EXPECT_NE(fingerprint({a}), fingerprint({{"a", a.identifier, "inode/directory"}}));
    EXPECT_NE(fingerprint({{"ab", "c", ""}}), fingerprint({{"a", "bc", ""}}));
}

// Conformance.

TEST_F(TypeDatabaseTest, conformsThroughParentsAndAliases) {
    aliases("application/x-pdf application/pdf\ntext/xml application/xml\n");
    subclasses("image/svg+xml text/xml\napplication/xml text/plain\n");
    EXPECT_TRUE(database().conforms("application/x-pdf", "application/pdf"));
    EXPECT_TRUE(database().conforms("application/pdf", "application/x-pdf"));
    EXPECT_TRUE(database().conforms("image/svg+xml", "application/xml"));
    EXPECT_TRUE(database().conforms("image/svg+xml", "text/xml"));
    EXPECT_TRUE(database().conforms("image/svg+xml", "text/plain"));
    EXPECT_FALSE(database().conforms("application/xml", "image/svg+xml"));
    EXPECT_FALSE(database().conforms("image/svg+xml", "image/png"));
}

TEST_F(TypeDatabaseTest, conformsByNature) {
    EXPECT_TRUE(database().conforms("text/x-unheard-of", "text/plain"));
    EXPECT_TRUE(database().conforms("image/png", "application/octet-stream"));
    EXPECT_TRUE(database().conforms("no/where", "no/where"));
    EXPECT_FALSE(database().conforms("image/png", "text/plain"));
    EXPECT_FALSE(database().conforms("inode/directory", "application/octet-stream"));
    EXPECT_FALSE(database().conforms("image/png", "no/where"));
}

TEST_F(TypeDatabaseTest, conformsThroughDeclaredParents) {
    EXPECT_TRUE(database().conforms("com.vemra.folio.document", kPackageTypeIdentifier));
    EXPECT_TRUE(database().conforms("com.vemra.tonemill.project", kPackageTypeIdentifier));
    EXPECT_TRUE(database().conforms(kPackageTypeIdentifier, kPackageTypeIdentifier));
    EXPECT_TRUE(database().conforms("com.vemra.folio.document", "inode/directory"));
    EXPECT_FALSE(database().conforms("com.vemra.folio.document", "com.vemra.tonemill.project"));
    EXPECT_FALSE(database().conforms("com.vemra.folio.document", "application/octet-stream"));
    EXPECT_FALSE(database().conforms("inode/directory", kPackageTypeIdentifier));
    EXPECT_FALSE(database().conforms("text/plain", kPackageTypeIdentifier));
}

TEST_F(TypeDatabaseTest, cannotBeToldThatAFileIsAPackage) {
    subclasses("text/plain com.vemra.package\n");
    aliases("text/plain com.vemra.package\n");
    EXPECT_FALSE(database().conforms("text/plain", kPackageTypeIdentifier));
}

TEST_F(TypeDatabaseTest, comesToAnEndInCircles) {
    aliases("x/one x/two\nx/two x/one\nx/self x/self\n");
    subclasses("a/a a/b\na/b a/c\na/c a/a\na/c text/plain\na/s a/s\n");
    EXPECT_TRUE(database().conforms("a/a", "a/c"));
    EXPECT_TRUE(database().conforms("a/a", "text/plain"));
    EXPECT_FALSE(database().conforms("a/a", "a/s"));
    EXPECT_FALSE(database().conforms("a/s", "a/a"));
    EXPECT_FALSE(database().conforms("x/one", "a/a"));
    EXPECT_TRUE(database().conforms("x/self", "x/self"));
}

TEST_F(TypeDatabaseTest, passesOverMalformedAliasesAndSubclasses) {
    aliases("x/one\n\n x/one x/two\nx/one x/two x/three\nx/one  x/two\none two\nx/a x/b");
    subclasses("y/one\ny/one y/\n/ y/one\ny/a y/b");
    EXPECT_FALSE(database().conforms("x/one", "x/two"));
    EXPECT_TRUE(database().conforms("x/a", "x/b"));
    EXPECT_TRUE(database().conforms("y/a", "y/b"));
}

// Files.

TEST_F(TypeDatabaseTest, isEmptyWithoutFiles) {
    const std::vector<std::string> nowhere{folder_ / "not-there", folder_.file("a-file")};
    const auto database = TypeDatabase::load(nowhere, {});
    EXPECT_TRUE(database->typeOfName("a.txt").empty());
    EXPECT_EQ(database->typeOf(S_IFREG, "a.txt", 5, [](std::size_t) { return Bytes(5, std::byte{'a'}); }).string(),
              "text/plain");
    EXPECT_FALSE(database->isPackageName("a.folio"));
}

TEST_F(TypeDatabaseTest, waitsForNoPipeAndReadsNoFolder) {
    globs("50:text/plain:*.txt\n", "system");
    folder_.folder("user/mime/magic");
    ASSERT_EQ(::mkfifo((folder_ / "user/mime/globs2").c_str(), 0600), 0);
    EXPECT_EQ(ofName("a.txt"), "text/plain");
}

TEST_F(TypeDatabaseTest, readsNoMoreThanSixteenMegabytesOfAFile) {
    std::string lines = "50:text/x-first:*.first\n";
    while (lines.size() < 16U * 1024 * 1024 - 10) lines += "# " + std::string(10'000, '-') + "\n";
    lines.resize(16U * 1024 * 1024 - 20);
    lines += "\n50:text/x-cut:*.cutoff\n50:text/x-last:*.last\n";
    globs(lines);
    EXPECT_EQ(ofName("a.first"), "text/x-first");
    EXPECT_EQ(ofName("a.cutoff"), "");
    EXPECT_EQ(ofName("a.c"), "");
    EXPECT_EQ(ofName("a.last"), "");
}

TEST(DataDirectories, followsTheEnvironment) {
    using List = std::vector<std::string>;
    EXPECT_EQ(dataDirectories("/home/a", nullptr, nullptr),
              (List{"/home/a/.local/share", "/usr/local/share", "/usr/share"}));
    EXPECT_EQ(dataDirectories("/home/a", "", ""), (List{"/home/a/.local/share", "/usr/local/share", "/usr/share"}));
    EXPECT_EQ(dataDirectories("/home/a", "/data", "/x:/y"), (List{"/data", "/x", "/y"}));
    EXPECT_EQ(dataDirectories(nullptr, nullptr, "/x"), (List{"/x"}));
}

TEST(DataDirectories, takesRelativePathsForNone) {
    using List = std::vector<std::string>;
    EXPECT_EQ(dataDirectories("/home/a", "data", "x:/y::./z:/y"), (List{"/home/a/.local/share", "/y"}));
    EXPECT_EQ(dataDirectories("home", nullptr, ":"), (List{}));
}

TEST(TypeDatabase, ofThisMachineNeverHasAnEmptyAnswer) {
    const auto unreadable = [](std::size_t) -> std::optional<Bytes> { return std::nullopt; };
    for (const int kind : {S_IFREG, S_IFDIR, S_IFLNK, S_IFIFO, S_IFSOCK, S_IFCHR, S_IFBLK, 0}) {
        EXPECT_FALSE(TypeDatabase::shared().typeOf(static_cast<mode_t>(kind), "a.txt", 1, unreadable).empty());
        EXPECT_FALSE(TypeDatabase::shared().typeOf(static_cast<mode_t>(kind), "a", 0, unreadable).empty());
    }
    EXPECT_TRUE(TypeDatabase::shared().isPackageName("a.folio"));
}

}  // namespace
}  // namespace cindral
