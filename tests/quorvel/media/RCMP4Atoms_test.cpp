// Titles written into and read from m4a files: both movie layouts, several
// languages side by side, interplay with titles written by the ffmpeg CLI,
// the text encodings a container may declare, and files that must be refused
// without being touched.
#include "QuorvelMedia/RCMP4Atoms.h"

#include <gtest/gtest.h>

extern "C" {
#include <libavformat/avformat.h>
}

#include <filesystem>
#include <fstream>
#include <map>

#include "Quorvel/files/RCFile.h"
#include "QuorvelMedia/RCFFmpegLogging.h"
#include "QuorvelMedia/RCInProcessMediaEngine.h"
#include "tests/support/AudioFixtures.h"
#include "tests/support/TempDirectory.h"

namespace quorvel {

void PrintTo(const RCMetadataItem& item, std::ostream* out) {
  *out << '"' << item.stringValue << "\"@" << (item.language.empty() ? "-" : item.language);
}

namespace {

namespace fs = std::filesystem;
using namespace std::string_literals;
using testing::decodeToPCM;
using testing::M4ALayout;
using testing::writeTone;

// What libavformat itself reports, as any other program using it would see.
std::map<std::string, std::string> libavformatTags(const std::string& path) {
  RCInstallFFmpegLogging();
  std::map<std::string, std::string> tags;
  AVFormatContext* input = nullptr;
  if (avformat_open_input(&input, path.c_str(), nullptr, nullptr) < 0) return tags;
  const AVDictionaryEntry* entry = nullptr;
  while ((entry = av_dict_get(input->metadata, "", entry, AV_DICT_IGNORE_SUFFIX))) {
    tags[entry->key] = entry->value;
  }
  avformat_close_input(&input);
  return tags;
}

using Items = std::vector<RCMetadataItem>;

// The title items the atom reader finds in `file` (none when it fails).
Items titles(const std::string& file) {
  auto items = RCMP4ReadTitleItems(file);
  EXPECT_TRUE(items) << items.error();
  return items.value_or(Items{});
}
std::size_t atomPosition(const std::string& bytes, const char* type) {
  auto atoms = RCMP4TopLevelAtoms(bytes.size(),
                                  [&](std::uint64_t offset, std::size_t size, std::uint8_t* out) {
                                    if (offset + size > bytes.size()) return false;
                                    std::memcpy(out, bytes.data() + offset, size);
                                    return true;
                                  });
  if (!atoms) return std::string::npos;
  for (std::size_t i = 0; i < atoms->size(); ++i) {
    if ((*atoms)[i].type == type) return i;
  }
  return std::string::npos;
}

// Byte images of hand-built atoms: big-endian words, an atom, a QuickTime
// text entry (length, language code, text), an iTunes-style value (type,
// locale, bytes).
std::string be(std::initializer_list<std::uint32_t> words, int bytes = 4) {
  std::string out;
  for (std::uint32_t v : words)
    for (int s = 8 * (bytes - 1); s >= 0; s -= 8) out.push_back(char(v >> s));
  return out;
}
std::string atom(const char* type, const std::string& payload) {
  return be({std::uint32_t(payload.size() + 8)}) + type + payload;
}
std::string textEntry(std::uint16_t language, const std::string& text) {
  return be({std::uint32_t(text.size()), language}, 2) + text;
}
std::uint16_t packedISO(const char* code) {
  return std::uint16_t((code[0] - 0x60) << 10 | (code[1] - 0x60) << 5 | (code[2] - 0x60));
}
std::string dataAtom(std::uint32_t type, const std::string& value) {
  return atom("data", be({type, 0}) + value);
}
std::span<const std::uint8_t> bytesOf(const std::string& bytes) {
  return {reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size()};
}

using RCMP4AtomsTest = testing::TempDirectoryTest;
using testing::readFile;

TEST_F(RCMP4AtomsTest, LanguagesSideBySideInBothLayoutsKeepTheAudio) {
  for (M4ALayout layout : {M4ALayout::MoovAtEnd, M4ALayout::MoovFirst}) {
    const bool moovFirst = layout == M4ALayout::MoovFirst;
    SCOPED_TRACE(moovFirst ? "moov first" : "moov at end");
    const std::string file = path(moovFirst ? "first.m4a" : "end.m4a");
    ASSERT_TRUE(writeTone(file, 2.0, "m4a", 44100, 2, 660.0, 0.4, layout));
    auto before = decodeToPCM(file);
    ASSERT_TRUE(before);

    // A single tagged title is one item, though libavformat shows it untagged too.
    ASSERT_TRUE(RCMP4WriteTitle(file, "Spaziergang", "deu"));
    EXPECT_EQ(libavformatTags(file)["title"], "Spaziergang");
    EXPECT_EQ(titles(file), (Items{{"Spaziergang", "deu"}}));
    ASSERT_TRUE(RCMP4WriteTitle(file, "A walk", "eng"));
    ASSERT_TRUE(RCMP4WriteTitle(file, "Promenade", "fr"));  // BCP-47 becomes "fra"
    ASSERT_TRUE(RCMP4WriteTitle(file, "Gang", "ger"));      // the same language as "deu"

    EXPECT_EQ(titles(file), (Items{{"Gang", "deu"}, {"A walk", "eng"}, {"Promenade", "fra"}}));

    auto tags = libavformatTags(file);
    EXPECT_EQ(std::tuple(tags["title-deu"], tags["title-eng"], tags["title-fra"]),
              std::tuple("Gang", "A walk", "Promenade"));

    // Same packets at (moved) offsets: the decoding is sample for sample the same.
    auto after = decodeToPCM(file);
    ASSERT_TRUE(after);
    EXPECT_EQ(after->frames(), before->frames());
    EXPECT_EQ(testing::maxAbsDifference(*before, *after), 0.0);

    const std::string bytes = readFile(file);
    EXPECT_EQ(atomPosition(bytes, "moov") < atomPosition(bytes, "mdat"), moovFirst);
    EXPECT_TRUE(hiddenFiles().empty()) << "temporary file left behind";
  }
}

TEST_F(RCMP4AtomsTest, UntaggedTitlesFromTheMuxerAndOursAreOneTitle) {
  // The muxer writes an untagged title as an iTunes-style item.
  const std::string file = path("muxed.m4a");
  ASSERT_TRUE(writeTone(file, {.seconds = 0.5, .metadata = {{"title", "From the muxer"}}}));
  const auto mode = fs::perms::owner_read | fs::perms::owner_write | fs::perms::group_read;
  fs::permissions(file, mode);
  EXPECT_EQ(titles(file), (Items{{"From the muxer", ""}}));

  ASSERT_TRUE(RCMP4WriteTitle(file, "Tagged", "deu"));
  EXPECT_EQ(titles(file), (Items{{"From the muxer", ""}, {"Tagged", "deu"}}));

  // Writing the untagged title replaces the muxer's rather than adding one.
  ASSERT_TRUE(RCMP4WriteTitle(file, "", ""));
  ASSERT_TRUE(RCMP4WriteTitle(file, "Ours", ""));
  EXPECT_EQ(titles(file), (Items{{"Tagged", "deu"}, {"Ours", ""}}));
  EXPECT_EQ(libavformatTags(file)["title-deu"], "Tagged");
  // Permissions survive the replacements.
  EXPECT_EQ(fs::status(file).permissions() & fs::perms::all, mode);
}

TEST_F(RCMP4AtomsTest, TitlesWrittenByTheFFmpegCommandLineAreRead) {
  // The QuickTime muxer writes a udta text title tagged "und".
  const std::string file = path("cli.mov");
  const std::string command =
      "ffmpeg -nostdin -hide_banner -loglevel error -y -f lavfi -i sine=d=0.3 -c:a aac "
      "-metadata title=Plain '" +
      file + "'";
  ASSERT_EQ(std::system(command.c_str()), 0);
  EXPECT_EQ(titles(file), (Items{{"Plain", ""}}));
  ASSERT_TRUE(RCMP4WriteTitle(file, "Hallo", "deu"));
  EXPECT_EQ(titles(file), (Items{{"Plain", ""}, {"Hallo", "deu"}}));
}

TEST_F(RCMP4AtomsTest, RefusedFilesAreLeftAsTheyWere) {
  testing::writeFile(path("text.m4a"), "just some text, not a movie\n");
  testing::writeFile(path("empty.m4a"), "");
  ASSERT_TRUE(writeTone(path("cut.m4a"), 1.0, "m4a"));  // movie header at the end
  fs::resize_file(path("cut.m4a"), fs::file_size(path("cut.m4a")) - 100);
  ASSERT_TRUE(writeTone(path("tone.flac"), 0.2, "flac"));
  for (const std::string& file :
       {path("text.m4a"), path("cut.m4a"), path("tone.flac"), path("empty.m4a")}) {
    SCOPED_TRACE(file);
    const std::string before = readFile(file);
    auto status = RCMP4WriteTitle(file, "x", "deu");
    ASSERT_FALSE(status);
    EXPECT_EQ(status.error().domain(), kRCMP4ErrorDomain);
    EXPECT_EQ(readFile(file), before);
    EXPECT_FALSE(RCMP4ReadTitleItems(file));
  }
  EXPECT_FALSE(RCMP4WriteTitle(path("missing.m4a"), "x", "deu"));
  EXPECT_FALSE(RCMP4WriteTitle(dir_.string(), "x", "deu"));

  const std::string good = path("good.m4a");
  ASSERT_TRUE(writeTone(good, 0.2, "m4a"));
  EXPECT_FALSE(RCMP4WriteTitle(good, "x", "not a language"));
  EXPECT_FALSE(RCMP4WriteTitle(good, std::string(70000, 'x'), "deu"));
}

TEST_F(RCMP4AtomsTest, ProbeAsksLibavformatWhenTheMovieHoldsNoTitle) {
  // A title in a top-level meta atom after the audio: libavformat reads it,
  // the movie atom holds none.
  const std::string file = path("outside.m4a");
  ASSERT_TRUE(writeTone(file, 0.3, "m4a"));
  const std::string hdlr = atom("hdlr", std::string(8, '\0') + "mdirappl" + std::string(9, '\0'));
  std::ofstream(file, std::ios::app | std::ios::binary)
      << atom("meta", "\0\0\0\0"s + hdlr + atom("ilst", atom("\xA9nam", dataAtom(1, "Oben"))));
  EXPECT_TRUE(titles(file).empty());
  auto probe = RCInProcessMediaEngine().probe(platform::URL::fileURLWithPath(file));
  ASSERT_TRUE(probe) << probe.error();
  EXPECT_EQ(probe->titleItems, (Items{{"Oben", ""}}));
}

TEST(RCMP4AtomsImageTest, TextIsDecodedAsTheContainerSaysAndKeptUnlessReplaced) {
  const std::string mac = atom("\xA9nam", textEntry(2, "Caf\x8E"));  // German, Mac Roman
  const std::string utf16 = atom("\xA9nam", textEntry(packedISO("eng"), "\xFE\xFF\0H\0i"s));
  const std::string oddLE = atom("\xA9nam", textEntry(packedISO("fra"), "\xFF\xFE\x41\0B"s));
  const std::string badUTF8 = atom("\xA9nam", textEntry(packedISO("ita"), "x\xFFy"));
  // UTF-16 "Ü" and a lone high surrogate; the integer item is no title.
  const std::string ilst =
      atom("ilst", atom("\xA9nam", dataAtom(2, "\0\xDC\xD8\0"s) + dataAtom(21, "\0\1"s)));
  const std::string moov =
      atom("moov", atom("udta", mac + utf16 + oddLE + badUTF8 + atom("meta", "\0\0\0\0"s + ilst)));
  auto items = RCMP4TitleItemsInMovie(bytesOf(moov));
  ASSERT_TRUE(items) << items.error();
  EXPECT_EQ(*items, (Items{{"Café", "deu"},
                           {"Hi", "eng"},
                           {"A\uFFFD", "fra"},
                           {"x\uFFFDy", "ita"},
                           {"Ü\uFFFD", ""}}));

  // Replacing the Mac entry stores UTF-8 under an ISO code; the others stay
  // as they were, byte for byte.
  auto rewritten = RCMP4MovieWithTitle(bytesOf(moov), 0, "Café", "deu");
  ASSERT_TRUE(rewritten) << rewritten.error();
  const std::string out(rewritten->begin(), rewritten->end());
  EXPECT_NE(out.find(atom("\xA9nam", textEntry(packedISO("deu"), "Café"))), std::string::npos);
  EXPECT_EQ(out.find("Caf\x8E"), std::string::npos);
  for (const std::string& kept : {utf16, oddLE, badUTF8}) {
    EXPECT_NE(out.find(kept), std::string::npos);
  }
  // Bytes that are not UTF-8 would not read back as written.
  EXPECT_FALSE(RCMP4MovieWithTitle(bytesOf(moov), 0, "Caf\x8E", "deu"));
}

TEST(RCMP4AtomsImageTest, AnEntryWhoseTextBeginsWithDataStaysText) {
  // Once the writer gives it an atom of its own, the second entry starts
  // like an iTunes-style data atom; writing again must neither drop nor change it.
  const std::string moov =
      atom("moov", atom("udta", atom("\xA9nam", textEntry(packedISO("eng"), "Hi") +
                                                    textEntry(packedISO("fra"), "data and more"))));
  auto once = RCMP4MovieWithTitle(bytesOf(moov), 0, "T", "");
  ASSERT_TRUE(once) << once.error();
  auto twice = RCMP4MovieWithTitle(*once, 0, "T", "");
  ASSERT_TRUE(twice) << twice.error();
  EXPECT_EQ(*twice, *once);
  auto items = RCMP4TitleItemsInMovie(*twice);
  ASSERT_TRUE(items);
  EXPECT_EQ(*items, (Items{{"Hi", "eng"}, {"data and more", "fra"}, {"T", ""}}));
}

TEST(RCMP4AtomsImageTest, ChunkOffsetsMoveOnlyBehindTheMovie) {
  // A hand-built file: ftyp, moov with one stco holding offsets before and
  // after the movie, then mdat.
  // Offsets inside ftyp (before the movie, it stays), in mdat and far beyond.
  auto stco = [](std::uint32_t shift) {
    return atom("stco", be({0, 3, 4, 500 + shift, 70000 + shift}));
  };
  const std::string moov =
      atom("moov", atom("trak", atom("mdia", atom("minf", atom("stbl", stco(0))))));
  const std::string file = atom("ftyp", "M4A ") + moov + atom("mdat", std::string(600, '\0'));
  auto image = RCMP4FileImageWithTitle(bytesOf(file), "T", "eng");
  ASSERT_TRUE(image) << image.error();
  const std::int64_t delta = std::int64_t(image->size()) - std::int64_t(file.size());
  EXPECT_EQ(delta, 8 + 8 + 4 + 1);  // udta + ©nam headers, length and language, "T"
  EXPECT_NE(std::string(image->begin(), image->end()).find(stco(delta)), std::string::npos);
  auto items = RCMP4TitleItemsInFileImage(*image);
  ASSERT_TRUE(items);
  EXPECT_EQ(*items, (Items{{"T", "eng"}}));
}

}  // namespace
}  // namespace quorvel
