// The interface the daemon publishes is the one the packaged XML documents:
// the same methods, in the same order, with the same arguments, reply
// arguments and no-reply annotations, the same signal, and the service's
// object path, bus name and error names.
#include <gtest/gtest.h>

#include <fstream>
#include <regex>
#include <sstream>
#include <string>
#include <vector>

#include "Quorvel/service/RCSSavedRecordingServiceConnection.h"
#include "Quorvel/service/RCSSavedRecordingServiceConstants.h"
#include "Quorvel/service/RCSSavedRecordingServiceErrors.h"

namespace quorvel {
namespace {

struct XmlMethod {
  std::string name;
  std::string in, out;
  std::vector<std::string> inNames, outNames;
  bool noReply = false;
};

std::vector<XmlMethod> methodsInXML(const std::string& xml, std::vector<std::string>& signals) {
  std::vector<XmlMethod> methods;
  std::regex element(R"re(<method name="(\w+)"\s*(/>|>([\s\S]*?)</method>))re");
  std::regex arg(R"re(<arg name="(\w+)" type="([^"]+)" direction="(in|out)"/>)re");
  for (std::sregex_iterator it(xml.begin(), xml.end(), element), end; it != end; ++it) {
    XmlMethod method{.name = (*it)[1]};
    std::string body = (*it)[3];
    for (std::sregex_iterator a(body.begin(), body.end(), arg); a != end; ++a) {
      bool in = (*a)[3] == "in";
      (in ? method.in : method.out) += (*a)[2];
      (in ? method.inNames : method.outNames).push_back((*a)[1]);
    }
    method.noReply = body.find("org.freedesktop.DBus.Method.NoReply") != std::string::npos;
    methods.push_back(method);
  }
  std::regex signal(R"re(<signal name="(\w+)")re");
  for (std::sregex_iterator it(xml.begin(), xml.end(), signal), end; it != end; ++it) {
    signals.push_back((*it)[1]);
  }
  return methods;
}

TEST(ServiceInterfaceTest, PublishedInterfaceMatchesThePackagedContract) {
  std::ifstream file(std::string(QUORVEL_SOURCE_DIR) +
                     "/packaging/org.quorvel.SavedRecordingService1.xml");
  std::stringstream text;
  text << file.rdbuf();
  const std::string xml = std::regex_replace(text.str(), std::regex("<!--[\\s\\S]*?-->"), "");
  std::vector<std::string> signals;
  auto documented = methodsInXML(xml, signals);
  auto published = RCSSavedRecordingServiceConnection::serviceInterface();

  EXPECT_EQ(published.name, "org.quorvel.SavedRecordingService1");
  ASSERT_EQ(documented.size(), 10u);
  ASSERT_EQ(published.methods.size(), documented.size());
  for (std::size_t i = 0; i < documented.size(); ++i) {
    const auto& declared = published.methods[i];
    const auto& xml = documented[i];
    SCOPED_TRACE(xml.name);
    EXPECT_EQ(declared.name, xml.name);
    EXPECT_EQ(declared.inputSignature, xml.in);
    EXPECT_EQ(declared.outputSignature, xml.out);
    EXPECT_EQ(declared.inputNames, xml.inNames);
    EXPECT_EQ(declared.outputNames, xml.outNames);
    EXPECT_EQ(declared.noReply, xml.noReply);
  }
  ASSERT_EQ(published.signals.size(), 1u);
  EXPECT_EQ(signals, std::vector<std::string>{published.signals[0].name});
  EXPECT_NE(xml.find(RCSSavedRecordingServiceObjectPath), std::string::npos);
  EXPECT_NE(xml.find(RCSSavedRecordingServiceMachServiceName), std::string::npos);
  for (const char* name : {RCSDBusErrorMissingCompositionAVURL, RCSDBusErrorConflictingSession,
                           RCSDBusErrorDeferredRequestSuperseded, RCSDBusErrorCompositionFailed,
                           RCSDBusErrorGeneric}) {
    EXPECT_NE(xml.find(name), std::string::npos) << name;
  }
}

}  // namespace
}  // namespace quorvel
