// What the service logs, pinned in one place: each scenario, driven through
// the service fixture, with the lines it must log, their levels and their
// order. A row's line matches a logged one of its level whose text is the
// row's ("[SavedRecordingService] " first unless it names its own tag), "…"
// standing for any run of characters; each listed line is logged exactly as
// often as the row lists it (never, for kNever). Some scenarios only show
// through these lines and check their replies and state here too.
#include <gtest/gtest.h>

#include <fmt/format.h>

#include <fstream>

#include "Quorvel/service/RCSSavedRecordingServiceErrors.h"
#include "Quorvel/waveform/RCWaveform.h"
#include "platform/NotificationCenter.h"
#include "quorveld/RCSAdditions.h"
#include "quorveld/RCSXPCTransaction.h"
#include "tests/quorveld/ServiceFixture.h"

namespace quorvel {
namespace {

using testing::LogLine;
constexpr int E = platform::kLogLevelError, N = platform::kLogLevelNotice,
              D = platform::kLogLevelDebug, kNever = 0;

bool matches(std::string_view pattern, std::string_view text) {
  const std::size_t any = pattern.find("…");
  if (any == std::string_view::npos) return pattern == text;
  if (!text.starts_with(pattern.substr(0, any))) return false;
  for (std::size_t at = any; at <= text.size(); ++at)
    if (matches(pattern.substr(any + std::string_view("…").size()), text.substr(at))) return true;
  return false;
}

struct Line {
  int level;
  std::string text;
  std::size_t times = 1;
};

struct Scenario {
  const char* name;
  std::function<void(SessionTest&)> run;
  std::vector<Line> lines;
};

std::string missing(const char* connection, const char* parameter, const char* selector) {
  return fmt::format(
      "ERROR: received invalid message on connection <connection {}>.  {} parameter is required "
      "for invocations of -{}",
      connection, parameter, selector);
}

// A keep-alive's debug line as it begins or ends.
Line keepAlive(const char* verb, const char* name) {
  return {D, fmt::format("[RCSXPCTransaction] {} XPC transaction: <RCSXPCTransaction 0x…, "
                         "name = \"{}\">",
                         verb, name)};
}

// How a preview token of `file` prints.
std::string preview(const char* file, const char* identifier = "…") {
  return fmt::format(
      "<RCSSavedRecordingAccessToken name=preview type=1 (shared) compositionAVURL=file://…/{} "
      "identifier={}>",
      file, identifier);
}

const std::string kExport = "[AssetExportController] ";
constexpr const char* kCapture = "prepareToCaptureToCompositionAVURL:accessRequestHandler:";

const std::vector<Scenario> kScenarios = {
    {"StartUpTwice",
     [](SessionTest& t) {
       t.settle();
       ASSERT_TRUE(t.service_->start());  // keeps its listener, runs another pass
       t.settle();
     },
     [] {
       const char* startUp = "Keep-alive for SavedRecordingService initialization";
       const std::vector<Line> once = {
           keepAlive("Activating", startUp),
           {D, "[RCSXPCTransaction] Root XPC transaction began."},
           {E,
            "[RCSavedRecordingsModel+RCSOrphanHandling] [Orphan-Handling] "
            "performOrphanRecoveryAndCleanupWithExternallyInUseComposedAVURLs: checking for "
            "orphaned recordings."},
           keepAlive("Deactivating", startUp),
           {D, "[RCSXPCTransaction] No XPC transactions remain. Ending root XPC transaction."}};
       std::vector<Line> twice = once;
       twice.insert(twice.begin() + 2, {N, "Starting service 'org.quorvel.SavedRecordingService'"});
       twice.insert(twice.end(), once.begin(), once.end());
       return twice;
     }()},

    // Redundant ends, and a scheduled end after an earlier one, are quiet.
    {"TransactionsBeginAndEndOnce",
     [](SessionTest& t) {
       auto tests = RCSXPCTransaction::initWithName("Keep-alive for tests");
       tests->beginTransaction();
       tests->endTransaction();
       tests->endTransaction();
       RCSXPCTransaction::initWithName("never begun")->endTransaction();
       auto scheduled = RCSXPCTransaction::initWithName("scheduled");
       scheduled->beginTransaction();
       scheduled->endTransactionOnDate(platform::Date::dateWithTimeIntervalSinceNow(-1.0));
       scheduled->endTransaction();
       t.advance(0s);
     },
     {keepAlive("Activating", "Keep-alive for tests"),
      keepAlive("Deactivating", "Keep-alive for tests"),
      {kNever, "…never begun…"},
      keepAlive("Activating", "scheduled"),
      keepAlive("Deactivating", "scheduled")}},

    {"ConnectionsAreAcceptedOnceAndEndedByVanishingOrLosingTheBus",
     [](SessionTest& t) {
       t.call(":1.1", "FetchExportingCompositionAVURLs");
       t.call(":1.1", "FetchExportingCompositionAVURLs");
       auto first = t.listener_->connection(":1.1");
       ASSERT_TRUE(first && rcs_isValid(*first));
       t.listener_->vanish(":1.1");
       t.call(":1.2", "DisableOrphanHandling");
       auto second = t.listener_->connection(":1.2");
       t.drainServiceQueue();
       EXPECT_FALSE(rcs_isValid(*first));
       ASSERT_TRUE(second && rcs_isValid(*second));
       t.listener_->loseBus();
       t.drainServiceQueue();
       EXPECT_FALSE(rcs_isValid(*second));
     },
     {{N, "Listener accepted new connection <connection :1.1>"},
      {E, "Connection invalidated: <connection :1.1>"},
      {N, "Listener accepted new connection <connection :1.2>"},
      {E, "Connection invalidated: <connection :1.2>"},
      {E, "Lost the connection to the bus"},
      {kNever, "…Connection interrupted…"}}},

    // The reply is checked before the URL: a request missing both is only
    // reported, and nothing answers it.
    {"PrepareRequestsCheckTheReplyBeforeTheURL",
     [](SessionTest& t) {
       for (const char* notAURL : {"", "relative/x.m4a", "http://example.com/x.m4a"}) {
         auto reply = t.call(":1.1", "PrepareToCapture", {notAURL});
         ASSERT_TRUE(reply->isAnswered());
         EXPECT_EQ(reply->errorName(), RCSDBusErrorMissingCompositionAVURL);
       }
       EXPECT_FALSE(t.call(":1.1", "PrepareToCapture", {""}, /*noReply=*/true)->isAnswered());
     },
     {{E, missing(":1.1", "compositionAVURL", kCapture), 3},
      {E, missing(":1.1", "accessRequestHandler", kCapture)}}},

    {"EveryPrepareKindLogsItsArrivalAndAnswersItsAccessType",
     [](SessionTest& t) {
       const std::tuple<const char*, BusValues, int> kinds[] = {
           {"PrepareToPreview", {"file:///recordings/New%20Recording.m4a"}, 1},
           {"PrepareToExport", {"file:///recordings/New%20Recording.m4a", false}, 1},
           {"PrepareToTrim", {"/recordings/Trim Recording.m4a"}, 2},
           {"PrepareToCapture", {"file:///recordings/Capture%20Recording.m4a"}, 2}};
       for (const auto& [member, arguments, accessType] : kinds) {
         auto reply = t.call(":1.3", member, arguments);
         t.advance(0s);  // an export answers once its finalization has
         EXPECT_EQ(t.accessType(reply), accessType) << member;
       }
       t.listener_->vanish(":1.3");  // its sessions close with it
     },
     {{D, "Received request to prepare 'New Recording.m4a' for preview..."},
      {D, "Received request to prepare 'New Recording.m4a' for export..."},
      {D, "Received request to prepare 'Trim Recording.m4a' for trimming..."},
      {D, "Received request to prepare 'Capture Recording.m4a' for capture..."}}},

    // An end without a token is reported; a fetch without a reply is
    // ignored altogether, so not even dispatched.
    {"EndWithoutATokenAndFetchWithoutAReply",
     [](SessionTest& t) {
       t.end(":1.4", BusValue::structure({"", 0, "", ""}));
       t.call(":1.4", "FetchExportingCompositionAVURLs", {}, /*noReply=*/true);
       t.drainServiceQueue();
     },
     {{D, "Ending access session: (null)."},
      {E, missing(":1.4", "accessToken", "endAccessSessionWithToken:")},
      {kNever, "…name = \"Dispatch to service queue\"…"}}},

    // What names nothing is no error: exporting a recording without a
    // bundle, and ending a token whose identifier is not a UUID.
    {"ARecordingWithoutABundleAndAForeignTokenAreNotErrors",
     [](SessionTest& t) {
       auto exported = t.call(":1.1", "PrepareToExport", {t.url("Nothing.m4a"), false});
       t.advance(0s);
       BusValue granted = t.token(exported);
       EXPECT_EQ(granted.fields().at(1).asInt32(), 1);
       t.end(":1.1", granted);
       t.end(":1.1", BusValue::structure({"preview", 1, t.url("X.m4a"), "no-uuid"}));
     },
     {{D, "Ending access session: " + preview("X.m4a", "no-uuid") + "."},
      {kNever, "…cannot load the composition…"},
      {kNever, "…parameter is required…"}}},

    // A second end of the same token changes nothing more.
    {"ASessionClosesInFourSteps",
     [](SessionTest& t) {
       auto preview = t.token(t.prepare(":1.1", "PrepareToPreview", "A.m4a"));
       t.end(":1.4", preview);
       t.settle();
       t.end(":1.4", preview);
       t.settle();
     },
     {{D, "Received request to prepare 'A.m4a' for preview..."},
      {D, "Ending access session: " + preview("A.m4a") + "."},
      {N, "Closing access session: <AssetAccessSession 0x…> " + preview("A.m4a") + "."},
      {N, "Scheduling orphan fragment cleanup for closing session"},
      {N, "Finally closing access session: <AssetAccessSession 0x…> " + preview("A.m4a")},
      {D, "Ending access session: " + preview("A.m4a") + "."}}},

    // Two requests wait behind a closing session: the newest wins, and is
    // re-issued once the closed session has left the registry.
    {"DeferredRequestsAreSupersededOrReissued",
     [](SessionTest& t) {
       auto preview = t.token(t.prepare(":1.1", "PrepareToPreview", "A.m4a"));
       auto held = t.holdServiceQueue();
       t.end(":1.1", preview);
       auto capture = t.prepare(":1.3", "PrepareToCapture", "A.m4a");
       auto trim = t.prepare(":1.4", "PrepareToTrim", "A.m4a");
       held->count_down();
       EXPECT_EQ(t.refusal(capture), RCSDBusErrorDeferredRequestSuperseded);
       EXPECT_EQ(t.accessType(trim), 2);
     },
     {{D, "scheduling deferred access for 'capture' request"},
      {D, "running deferred access block for 'capture' request -- was canceled!"},
      {D, "scheduling deferred access for 'trimming' request"},
      {D, "running deferred access block for 'trimming' request -- will re-issue request"}}},

    // The capture's recording is finalized all the same.
    {"AVanishedClientsSessionsAreTerminatedAndItsCaptureFinalized",
     [](SessionTest& t) {
       auto editor = t.makeRecording("A", {0.2});
       t.token(t.prepare(":1.1", "PrepareToCapture", "A.m4a"));
       t.token(t.prepare(":1.1", "PrepareToPreview", "C.m4a"));
       t.listener_->vanish(":1.1");
       t.settle();
       EXPECT_EQ(t.openSessions(), 0u);
       EXPECT_EQ(t.decomposed(editor), 0u);
       EXPECT_TRUE(
           std::filesystem::exists(RCWaveform::waveformURLForAVURL(editor.composedAVURL()).path()));
     },
     {{E, "Connection invalidated: <connection :1.1>"},
      {N, "Terminating access session … for terminated connection: <connection :1.1>"},
      {N, "Closing access session: …."},
      {N, "Terminating access session … for terminated connection: <connection :1.1>"},
      {N, "Closing access session: …."},
      {kNever, "…Finally closing access session…"}}},

    {"OrphanedFragmentsAreNamedWhenCleanedOrWhenTheBundleDoesNotLoad",
     [](SessionTest& t) {
       auto editor = t.makeRecording("Walk", {0.2});
       std::ofstream(editor.composition()->bundleURL().path() + "/stray.m4a") << "audio";
       t.end(":1.1", t.token(t.prepare(":1.1", "PrepareToPreview", "Walk.m4a")));
       t.token(t.prepare(":1.2", "PrepareToPreview", "Nothing.m4a"));
     },
     {{N,
       "NOTE: cleaning (deleting) orphaned fragment '…/Walk.composition/stray.m4a' no "
       "longer in use."},
      {E,
       "WARNING: attempt to delete orphaned fragments for file://…/Nothing.m4a failed "
       "because the composition failed to load"}}},

    // A capture's end schedules a finalization; a preview's does not.
    {"ACaptureEndedNormallyIsFinalizedInTheBackground",
     [](SessionTest& t) {
       auto editor = t.makeRecording("Lecture", {0.2});
       t.end(":1.1", t.token(t.prepare(":1.1", "PrepareToCapture", "Lecture.m4a")));
       t.settle();
       EXPECT_EQ(t.decomposed(editor), 0u);
       t.end(":1.1", t.token(t.prepare(":1.1", "PrepareToPreview", "Lecture.m4a")));
       t.settle();
       t.expectNothingLeft();
     },
     {{N, "Received request to schedule finalization of 'Lecture.m4a'..."},
      {D, kExport + "RUNNING asset finalization operation: <CompositionExportOperation: …> : "
                    "…/Lecture.m4a"},
      {D, kExport + "FINISHED asset finalization operation: <CompositionExportOperation: …> : "
                    "…/Lecture.m4a"}}},

    // The export is answered without a token (and without an error), the
    // waveform is skipped, and the bundle stays.
    {"ABundleThatDoesNotLoadIsNotExportedAndItsWaveformIsSkipped",
     [](SessionTest& t) {
       auto editor = t.makeRecording("Broken", {0.2});
       std::ofstream(editor.composition()->bundleURL().path() + "/manifest.json") << "{ not json";
       auto exported = t.call(":1.1", "PrepareToExport", {t.url("Broken.m4a"), true});
       t.advance(0s);
       EXPECT_EQ(t.accessType(exported), 0);
       EXPECT_EQ(t.openSessions(), 0u);
       EXPECT_TRUE(std::filesystem::exists(editor.composition()->bundleURL().path()));
     },
     {{E, kExport +
              "ERROR: <CompositionExportOperation: …> : …/Broken.m4a failed with error: Error "
              "Domain=org.quorvel.SavedRecordingService.ErrorDomain Code=401"},
      {E, kExport +
              "ERROR: Skipping <GenerateWaveformOperation: …> : …/Broken.m4a because a dependency "
              "failed with error: …"}}},

    {"ADamagedFragmentIsNamed",
     [](SessionTest& t) {
       auto editor = t.makeRecording("Damaged", {0.4, 0.2});
       SessionTest::damage(editor.composition()->fragments()[1].AVOutputURL().path());
       auto exported = t.call(":1.1", "PrepareToExport", {t.url("Damaged.m4a"), false});
       t.advance(0s);
       t.end(":1.1", t.token(exported));
     },
     {{E,
       "[RCCompositionController] WARNING: leaving fragment '…' of Damaged.composition out of the "
       "composed audio: it cannot be read"}}},

    // A deferred request taken out for re-issue whose client vanishes
    // before it runs hands its turn to the recording's waiting finalization.
    {"ARequestWhoseClientVanishedBeforeItsReissueLetsTheFinalizationRun",
     [](SessionTest& t) {
       auto editor = t.makeRecording("Gone", {0.2});
       auto capture = t.token(t.prepare(":1.1", "PrepareToCapture", "Gone.m4a"));
       t.service_->_attemptToRunDeferredFinalizationOfCompositionAVURL(editor.composedAVURL());
       t.drainServiceQueue();
       ASSERT_EQ(t.waitingFinalizations(), 1u);
       // The queue runs the close's first step, the preview's deferral, the
       // cleanup (which queues the final step) and then a marker, which lets
       // the client vanish while the final step waits; that step takes the
       // preview out and queues its re-issue behind the disconnection.
       auto held = t.holdServiceQueue();
       t.end(":1.1", capture);
       t.prepare(":1.2", "PrepareToPreview", "Gone.m4a");
       auto marker = std::make_shared<std::latch>(1);
       auto reached = std::make_shared<std::latch>(1);
       t.service_->serviceSerialQueue().async([&t, marker, reached] {
         t.service_->serviceSerialQueue().async([marker, reached] {
           reached->count_down();
           marker->wait();
         });
       });
       held->count_down();
       reached->wait();
       t.listener_->vanish(":1.2");
       marker->count_down();
       t.settle();
       EXPECT_EQ(t.decomposed(editor), 0u);
       t.expectNothingLeft();
     },
     {{N,
       "Not opening 'preview' access session for 'Gone.m4a': connection <connection :1.2> "
       "has ended"}}},

    // Named launch events are posted in-process on the main queue, not on
    // the delivery thread; one without a name is ignored.
    {"LaunchEventsArePostedInProcessOnTheMainQueue",
     [](SessionTest& t) {
       std::vector<std::string> posted;
       auto& center = platform::NotificationCenter::defaultCenter();
       auto observer = center.addObserver(
           "com.example.RecordingsChanged",
           [&posted](const platform::Notification& note) { posted.push_back(note.name); });
       t.listener_->deliverSignal("org.quorvel.Events1", "Event",
                                  {"com.example.RecordingsChanged"});
       t.listener_->deliverSignal("org.quorvel.Events1", "Event", {});
       EXPECT_TRUE(posted.empty());
       t.main_.runUntilIdle();
       EXPECT_EQ(posted, std::vector<std::string>{"com.example.RecordingsChanged"});
       center.removeObserver(observer);
     },
     {{D, "Posting launch event 'com.example.RecordingsChanged'"},
      {E, "Ignoring a launch event without a name"}}},
};

void PrintTo(const Scenario& scenario, std::ostream* out) { *out << scenario.name; }

class ServiceLogTest : public SessionTest, public ::testing::WithParamInterface<Scenario> {};

TEST_P(ServiceLogTest, LogsTheScenariosLines) {
  GetParam().run(*this);
  drainServiceQueue();
  const std::vector<LogLine> logged = log_.lines();
  std::string all;
  for (const auto& line : logged) all += std::to_string(line.level) + " " + line.text + "\n";
  auto next = logged.begin();
  for (const Line& want : GetParam().lines) {
    const std::string text = want.text.starts_with("[") || want.text.starts_with("…")
                                 ? want.text
                                 : "[SavedRecordingService] " + want.text;
    auto same = [&](const LogLine& line) {
      return (want.level == kNever || line.level == want.level) && matches(text, line.text);
    };
    std::size_t listed = 0;
    for (const Line& other : GetParam().lines)
      listed += other.level == want.level && other.text == want.text ? other.times : 0;
    EXPECT_EQ(std::size_t(std::ranges::count_if(logged, same)), want.level == kNever ? 0 : listed)
        << want.level << " " << text;
    for (std::size_t time = 0; want.level != kNever && time < want.times; ++time) {
      next = std::find_if(next, logged.end(), same);
      EXPECT_NE(next, logged.end()) << "not in order: " << text;
      if (next != logged.end()) ++next;
    }
  }
  if (HasFailure()) ADD_FAILURE() << "what was logged:\n" << all;
}

INSTANTIATE_TEST_SUITE_P(Scenarios, ServiceLogTest, ::testing::ValuesIn(kScenarios),
                         [](const auto& info) { return std::string(info.param.name); });

}  // namespace
}  // namespace quorvel
