#include "Quorvel/service/RCSSavedRecordingServiceConnection.h"

#include "Quorvel/service/RCSSavedRecordingServiceConstants.h"

namespace quorvel {

platform::InterfaceDescription RCSSavedRecordingServiceConnection::serviceInterface() {
  auto method = [](const char* name, const char* in, std::vector<std::string> inNames,
                   const char* out, std::vector<std::string> outNames, bool noReply = false,
                   const char* interface = "") {
    return platform::MethodDescription{.name = name,
                                       .inputSignature = in,
                                       .inputNames = std::move(inNames),
                                       .outputSignature = out,
                                       .outputNames = std::move(outNames),
                                       .noReply = noReply,
                                       .handler = {},
                                       .interface = interface};
  };
  return platform::InterfaceDescription{
      .name = RCSSavedRecordingServiceInterfaceName,
      .methods =
          {
              method(RCSMethodPrepareToCapture, "s", {"compositionAVURL"}, "(siss)",
                     {"accessToken"}),
              method(RCSMethodPrepareToPreview, "s", {"compositionAVURL"}, "(siss)",
                     {"accessToken"}),
              method(RCSMethodPrepareToExport, "sb", {"compositionAVURL", "cacheWaveform"},
                     "(siss)", {"accessToken"}),
              method(RCSMethodPrepareToTrim, "s", {"compositionAVURL"}, "(siss)", {"accessToken"}),
              method(RCSMethodEndAccessSession, "(siss)", {"accessToken"}, "", {},
                     /*noReply=*/true),
              method(RCSMethodDisableOrphanedFragmentCleanup, "s", {"compositionAVURL"}, "", {}),
              method(RCSMethodEnableOrphanedFragmentCleanup, "s", {"compositionAVURL"}, "", {},
                     /*noReply=*/true),
              method(RCSMethodDisableOrphanHandling, "", {}, "", {}),
              method(RCSMethodEnableOrphanHandling, "", {}, "", {}),
              method(RCSMethodFetchExportingCompositionAVURLs, "", {}, "as", {"compositionAVURLs"}),
              // Beside the contract: who holds which recording.
              method(RCSMethodListAccessSessions, "", {}, "a(sissxsuus)", {"sessions"}, false,
                     RCSSavedRecordingServiceSessionsInterfaceName),
              method(RCSMethodListDeferredRequests, "", {}, "a(sisxsuus)", {"requests"}, false,
                     RCSSavedRecordingServiceSessionsInterfaceName),
          },
      .signals =
          {
              platform::SignalDescription{
                  .name =
                      RCSavedRecordingServiceDidChangeExportingCompositionAVURLsDistributedNotification,
                  .signature = "",
                  .names = {}},
              platform::SignalDescription{
                  .name = RCSSignalAccessSessionsChanged,
                  .signature = "s",
                  .names = {"compositionAVURL"},
                  .interface = RCSSavedRecordingServiceSessionsInterfaceName},
          },
  };
}

}  // namespace quorvel
