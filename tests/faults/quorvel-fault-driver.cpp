// quorvel-fault-driver: runs one writing operation of the recordings
// framework against a recordings directory, and checks what a run of it left
// there. tests/faults/fault_points_test.cpp runs it under strace, failing or
// killing it at each write, fsync, rename and unlink it makes in the
// directory, one at a time.
//
//   quorvel-fault-driver prepare OP DIR   makes DIR, the state OP starts from
//   quorvel-fault-driver run OP DIR       performs OP; exit 0 when it reported
//                                         success, 1 when it reported an error
//   quorvel-fault-driver after OP DIR killed|failed|succeeded [unlink]
//       checks DIR after a run that ended so (and, with "unlink", had an
//       unlink fail); after a killed run, or a failed unlink, does what the
//       next start of the daemon does (the orphan run, once leftovers are
//       old enough for it); then runs OP again and checks that it completed.
//       Prints each problem; exit 0 when there is none.
//
// Media work runs in process, so the operation's writes (all but the
// waveform's, which its data source makes on its own thread) happen on the
// main thread, where strace's per-thread counting of calls finds them again.
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <filesystem>
#include <functional>
#include <string>
#include <string_view>
#include <vector>

#include "Models/RCSavedRecordingsModel+RCSOrphanHandling.h"
#include "Quorvel/composition/RCComposition.h"
#include "Quorvel/composition/RCCompositionController.h"
#include "Quorvel/composition/RCCompositionEditor.h"
#include "Quorvel/database/RCSavedRecordingsModel.h"
#include "Quorvel/files/RCFile.h"
#include "Quorvel/files/RCMD5.h"
#include "Quorvel/media/RCMediaEngine.h"
#include "Quorvel/waveform/RCWaveformFile.h"
#include "QuorvelMedia/RCFileInputWaveformDataSource.h"
#include "QuorvelMedia/RCInProcessMediaEngine.h"
#include "QuorvelMedia/RCMP4Atoms.h"
#include "platform/Log.h"
#include "tests/support/AudioFixtures.h"

namespace quorvel::faults {
namespace {

namespace fs = std::filesystem;
using platform::URL;

// One AAC frame at 44.1 kHz and then some: composed lengths are compared
// within this.
constexpr double kTolerance = 0.1;

struct Context {
  fs::path dir;
  std::vector<std::string> problems;

  URL url(const std::string& name) const { return URL::fileURLWithPath((dir / name).string()); }
  std::string path(const std::string& name) const { return (dir / name).string(); }
  void problem(std::string text) { problems.push_back(std::move(text)); }
  bool expect(bool condition, std::string text) {
    if (!condition) problem(std::move(text));
    return condition;
  }
  // The database; its error is a problem too.
  platform::Result<std::shared_ptr<RCSavedRecordingsModel>> model() {
    auto opened = RCSavedRecordingsModel::modelWithDirectory(dir.string());
    if (!opened) problem("the database does not open: " + opened.error().description());
    return opened;
  }
  // Whether the files are in the new state; `what` must be in the new state
  // or the old one, and in the new one when the operation reported success.
  bool eitherState(bool isNew, bool isOld, bool done, const std::string& what) {
    if (!isNew && !isOld) problem(what + " is neither the old nor the new");
    if (isOld && !isNew && done) problem("the operation reported success, but " + what + " is old");
    return isNew;
  }
};

platform::Status tone(const std::string& path, double seconds, double frequency = 440) {
  const std::string format = fs::path(path).extension().string().substr(1);
  return testing::writeTone(path, seconds, format, 44100, 1, frequency);
}

// The status of a result, for the steps of an operation: each returns the
// first failure with TRY.
template <class T>
platform::Status statusOf(const platform::Result<T>& result) {
  if (result) return {};
  return platform::fail(result.error());
}
platform::Status statusOf(const platform::Status& status) { return status; }
#define TRY(step) \
  if (auto status = statusOf(step); !status) return status

// Seconds of decoded audio in `path`; NaN when it does not decode.
double decodedSeconds(const std::string& path) {
  auto pcm = testing::decodeToPCM(path);
  return pcm ? pcm->seconds() : std::nan("");
}

bool near(double a, double b) { return std::abs(a - b) < kTolerance; }

platform::Status check(platform::Status status, const char* what) {
  if (!status) std::fprintf(stderr, "%s: %s\n", what, status.error().description().c_str());
  return status;
}

// Appends a take of `seconds` to `editor`, made outside the directory.
platform::Status appendTake(Context& context, RCCompositionEditor& editor, double seconds,
                            double frequency) {
  const std::string source = context.dir.string() + "-take.wav";
  TRY(tone(source, seconds, frequency));
  auto appended = editor.appendFragmentFromAudioFile(URL::fileURLWithPath(source));
  fs::remove(source);
  return statusOf(appended);
}

// A recording "Walk" made as an app makes it, from fragments of `seconds`.
platform::Status makeRecording(Context& context, const std::vector<double>& seconds) {
  auto model = context.model();
  TRY(model);
  auto editor = RCCompositionEditor::createCompositionForNewRecording(**model, "Walk");
  TRY(editor);
  for (std::size_t i = 0; i < seconds.size(); ++i)
    TRY(appendTake(context, *editor, seconds[i], 440 + 110 * i));
  return {};
}

// A bare composed file "Walk.m4a" with its database record.
platform::Status makeComposedFile(Context& context, double seconds) {
  TRY(tone(context.path("Walk.m4a"), seconds));
  auto model = context.model();
  TRY(model);
  (*model)->insertRecordingWithAudioFile(context.path("Walk.m4a"), seconds, platform::Date::now());
  return (*model)->saveIfNecessary();
}

std::shared_ptr<RCComposition> loadWalk(Context& context) {
  auto loaded = RCComposition::load(context.url("Walk.composition"));
  if (!loaded) {
    context.problem("Walk.composition does not load: " + loaded.error().description());
    return nullptr;
  }
  return *loaded;
}

// Checks that hold after any run of any operation: the database opens and
// each record's audio is there (its file, or its bundle's fragments before
// the first compose), every bundle loads and has the fragment files its
// manifest lists, and, unless the run was killed, no temporary file is left.
void checkDirectory(Context& context, bool temporaryFilesAllowed) {
  std::error_code error;
  for (auto it = fs::recursive_directory_iterator(context.dir, error);
       it != fs::recursive_directory_iterator(); it.increment(error)) {
    const std::string name = it->path().filename().string();
    if (RCIsAtomicReplaceTempName(name) && !temporaryFilesAllowed)
      context.problem("temporary file left: " + it->path().string());
    if (it->path().extension() == ".composition" && it->is_directory()) {
      auto loaded = RCComposition::load(URL::fileURLWithPath(it->path().string()));
      if (!loaded) {
        context.problem(name + " does not load: " + loaded.error().description());
        continue;
      }
      for (const auto& fragment : (*loaded)->fragments())
        context.expect(fs::exists(fragment.AVOutputURL().path()),
                       name + " lists a fragment that is gone: " + fragment.AVOutputURL().path());
    }
  }
  auto model = context.model();
  if (!model) return;
  auto walked = (*model)->enumerateExistingRecordingsWithBlock([&](const auto& recording, bool&) {
    auto url = recording->url();
    if (!url) return context.problem("a record without a file");
    if (fs::exists(url->path())) return;
    auto bundle = RCComposition::compositionBundleURLForComposedAVURL(*url);
    auto loaded = RCComposition::load(bundle);
    context.expect(loaded && *loaded && !(*loaded)->fragments().empty(),
                   "a record whose audio is gone: " + url->path());
  });
  context.expect(walked.has_value(), "the database cannot be read");
}

// The database's record of `name`, or nullptr.
std::shared_ptr<RCSavedRecording> recordOf(Context& context, const std::string& name) {
  auto model = context.model();
  if (!model) return nullptr;
  auto found = (*model)->recordingWithURL(context.url(name));
  return found ? *found : nullptr;
}

// The operations: what each starts from, does, and must leave. `check` gets
// `done` true when the operation reported success (it must then have done
// all of its work); otherwise the state may be the old one or the new one,
// and `check` says which it is.
struct Operation {
  std::string_view name;
  std::function<platform::Status(Context&)> prepare;
  std::function<platform::Status(Context&)> run;
  // Checks the operation's own files; returns whether the new state is there.
  std::function<bool(Context&, bool done)> check;
};

const std::vector<Operation>& operations() {
  static const std::vector<Operation> table{
      // Finalization of a recording whose composed file (with a title)
      // holds its first take, after a second one was appended: the composed
      // file with the title carried over, its waveform, the manifest, the
      // database's duration, then the fragments go.
      {"compose",
       [](Context& c) -> platform::Status {
         TRY(makeRecording(c, {1.0}));
         TRY(RCCompositionController::compositionControllerForComposedAVURL(c.url("Walk.m4a"))
                 ->composeNow(false, true));
         // A title written into the composed file, which composing keeps.
         TRY(RCMediaEngine::current()->writeTitle(c.url("Walk.m4a"), "Gang", "deu"));
         auto editor = RCCompositionEditor::editorForComposedAVURL(c.url("Walk.m4a"));
         TRY(editor);
         return appendTake(c, *editor, 0.5, 880);
       },
       [](Context& c) {
         return RCCompositionController::compositionControllerForComposedAVURL(c.url("Walk.m4a"))
             ->composeNow(true, true);
       },
       [](Context& c, bool done) {
         const double seconds = decodedSeconds(c.path("Walk.m4a"));
         const bool composed = near(seconds, 1.5);
         c.expect(composed || near(seconds, 1.0),
                  "Walk.m4a is neither the old composed file nor the new one: " +
                      std::to_string(seconds) + " s");
         auto titles = RCMP4ReadTitleItems(c.path("Walk.m4a"));
         c.expect(titles && titles->size() == 1 && titles->front().stringValue == "Gang",
                  "Walk.m4a lost its title");
         auto composition = loadWalk(c);
         if (!composition) return false;
         const auto fragments = composition->fragments();
         // Fragments leave the manifest only with their audio composed.
         c.expect(composed || fragments.size() == 2,
                  "fragments left the manifest, but the composed file is the old one");
         auto waveform = RCReadWaveformFile(c.url("Walk.waveform"));
         c.expect(waveform.has_value(), "Walk.waveform does not read");
         auto record = recordOf(c, "Walk.m4a");
         c.expect(record != nullptr, "Walk has no record");
         // The fragments' files, no longer listed, may stay for the fragment
         // cleanup when the compose could not remove them.
         const bool newState = composed && fragments.empty() &&
                               near(composition->composedDuration(), 1.5) && record &&
                               near(record->duration(), 1.5);
         if (done && !newState)
           c.problem(std::string("the compose reported success, but ") +
                     (!composed            ? "Walk.m4a is the old file"
                      : !fragments.empty() ? "the manifest was not saved"
                      : !record || !near(record->duration(), 1.5)
                          ? "the database has the old duration"
                          : "the manifest has the wrong duration"));
         return newState;
       }},
      // A title written into a composed m4a file (the media engine's title
      // job), beside the titles of other languages.
      {"title",
       [](Context& c) -> platform::Status {
         TRY(makeComposedFile(c, 1.0));
         TRY(RCMediaEngine::current()->writeTitle(c.url("Walk.m4a"), "Walk", ""));
         return RCMediaEngine::current()->writeTitle(c.url("Walk.m4a"), "Gang", "deu");
       },
       [](Context& c) {
         return RCMediaEngine::current()->writeTitle(c.url("Walk.m4a"), "Spaziergang", "deu");
       },
       [](Context& c, bool done) {
         c.expect(near(decodedSeconds(c.path("Walk.m4a")), 1.0), "Walk.m4a does not decode");
         auto items = RCMP4ReadTitleItems(c.path("Walk.m4a"));
         if (!c.expect(items.has_value(), "the titles of Walk.m4a do not read")) return false;
         std::string german, untagged;
         for (const auto& item : *items)
           (item.language.empty() ? untagged : german) = item.stringValue;
         c.expect(untagged == "Walk", "the untagged title changed: '" + untagged + "'");
         return c.eitherState(german == "Spaziergang", german == "Gang", done,
                              "the German title '" + german + "'");
       }},
      // The orphan run over a bundle and a file the database lacks, a copy of
      // that file, and a file without audio.
      {"recovery",
       [](Context& c) -> platform::Status {
         TRY(c.model());  // made before the orphans
         return testing::writeOrphans(c.dir.string());
       },
       [](Context& c) -> platform::Status {
         auto model = c.model();
         TRY(model);
         RCSOrphanHandling(**model)
             .performOrphanRecoveryAndCleanupWithExternallyInUseComposedAVURLs({});
         return {};
       },
       [](Context& c, bool) {
         c.expect(fs::exists(c.path("Lost.composition/Lost-1.wav")), "Lost's fragment is gone");
         const bool found = fs::exists(c.path("Found.m4a")),
                    again = fs::exists(c.path("Found again.m4a"));
         c.expect(found || again, "both copies of Found are gone");
         auto lost = recordOf(c, "Lost.m4a");
         auto recovered = recordOf(c, found ? "Found.m4a" : "Found again.m4a");
         return lost && recovered && found != again && !fs::exists(c.path("Noise.wav"));
       }},
      // A fragment cleanup: a fragment still open-ended (its capture never
      // finished) is closed at its file's end, and a fragment file the
      // manifest no longer lists is deleted.
      {"cleanup",
       [](Context& c) -> platform::Status {
         TRY(makeRecording(c, {1.0, 0.5}));
         auto composition = loadWalk(c);
         if (!composition) return platform::fail(platform::posixError(EIO, "no bundle"));
         RCCompositionManifest manifest = composition->manifest();
         manifest.fragments.at(1).contentDuration.reset();
         manifest.recomputeTimeRanges();
         TRY(RCComposition(c.url("Walk.composition"), manifest).saveMetadataToDefaultLocation());
         return tone(c.path("Walk.composition/Unused.wav"), 0.25);
       },
       [](Context& c) -> platform::Status {
         auto controller =
             RCCompositionController::compositionControllerForComposedAVURL(c.url("Walk.m4a"));
         controller->rcs_repairDecomposedFragmentMetadataIfNecessary();
         if (auto repaired = controller->composition()) {
           repaired->enumerateOrphanedFragmentsWithBlock(
               [](const RCCompositionFragment& fragment, bool&) {
                 (void)fragment.deleteFromFilesystem();
               });
         }
         return {};
       },
       [](Context& c, bool) {
         auto composition = loadWalk(c);
         if (!composition) return false;
         const auto& fragments = composition->manifest().fragments;
         if (!c.expect(fragments.size() == 2, "a fragment left the manifest")) return false;
         const auto& second = fragments[1].contentDuration;
         c.expect(!second || near(*second, 0.5), "the open fragment was closed at a wrong end");
         return second && !fs::exists(c.path("Walk.composition/Unused.wav"));
       }},
      // A waveform computed from a composed file and saved beside it.
      {"waveform", [](Context& c) { return makeComposedFile(c, 2.0); },
       [](Context& c) -> platform::Status {
         // No intermediate saves: those follow the wall clock.
         RCFileInputWaveformDataSource source(c.url("Walk.m4a"), true, 1e9);
         source.beginLoading();
         if (source.waitUntilFinished()) return {};
         return platform::fail(source.error().value_or(platform::posixError(EIO, "no error")));
       },
       [](Context& c, bool done) {
         c.expect(!fs::exists(c.path("Walk.waveform.partial")), "the side file is left");
         if (!fs::exists(c.path("Walk.waveform"))) {
           if (done) c.problem("the waveform reported success without a file");
           return false;
         }
         auto waveform = RCReadWaveformFile(c.url("Walk.waveform"));
         if (!c.expect(waveform.has_value(), "Walk.waveform does not read")) return false;
         const double seconds =
             double(waveform->length() * waveform->samplesPerPixel()) / waveform->sampleRate();
         return c.expect(near(seconds, 2.0), "Walk.waveform has the wrong length");
       }},
  };
  return table;
}

// What the daemon does when it starts after a crash: the orphan run, which
// removes the leftovers of interrupted atomic replaces once they are old
// enough not to be a write in progress (here aged past that limit, as if
// the crash were that long ago).
void restart(Context& context) {
  std::error_code error;
  const auto age =
      std::chrono::seconds(static_cast<long>(RCSOrphanHandling::kMinimumTempFileAge) + 60);
  for (auto it = fs::recursive_directory_iterator(context.dir, error);
       it != fs::recursive_directory_iterator(); it.increment(error)) {
    if (RCIsAtomicReplaceTempName(it->path().filename().string()))
      fs::last_write_time(it->path(), fs::last_write_time(it->path()) - age, error);
  }
  if (auto model = context.model())
    RCSOrphanHandling(**model).performOrphanRecoveryAndCleanupWithExternallyInUseComposedAVURLs({});
}

int usage() {
  std::fprintf(stderr,
               "usage: quorvel-fault-driver prepare|run OP DIR\n"
               "       quorvel-fault-driver after OP DIR killed|failed|succeeded [unlink]\n");
  return 2;
}

int driverMain(int argc, char** argv) {
  if (argc < 4) return usage();
  const std::string command = argv[1];
  const auto operation = std::ranges::find(operations(), argv[2], &Operation::name);
  if (operation == operations().end()) return usage();
  platform::setConsoleLogging(false);
  RCUseInProcessMediaEngine();
  Context context{fs::absolute(argv[3])};
  RCSavedRecordingsModel::setSavedRecordingsDirectory(context.dir.string());

  if (command == "prepare") {
    fs::create_directories(context.dir);
    auto status = check(operation->prepare(context), "prepare");
    for (const auto& problem : context.problems) std::fprintf(stderr, "%s\n", problem.c_str());
    return status && context.problems.empty() ? 0 : 1;
  }
  if (command == "run") {
    auto status = operation->run(context);
    return check(status, "run") ? 0 : 1;
  }
  if (command != "after" || argc < 5 || argc > 6) return usage();
  const std::string outcome = argv[4];
  // A temporary file stays when the process died, or when removing it was
  // what failed; the next start of the daemon removes it.
  const bool leftovers = outcome == "killed" || (argc == 6 && argv[5] == std::string("unlink"));
  checkDirectory(context, leftovers);
  operation->check(context, outcome == "succeeded");
  // Whatever the run left, the operation completes once the disk works
  // again (after a crash, once the daemon has restarted).
  if (leftovers) restart(context);
  if (auto again = operation->run(context); !again) {
    context.problem("the operation fails afterwards: " + again.error().description());
  }
  checkDirectory(context, false);
  if (!operation->check(context, true)) context.problem("(after running the operation again)");
  for (const auto& problem : context.problems) std::printf("%s\n", problem.c_str());
  return context.problems.empty() ? 0 : 1;
}

}  // namespace
}  // namespace quorvel::faults

int main(int argc, char** argv) { return quorvel::faults::driverMain(argc, argv); }
