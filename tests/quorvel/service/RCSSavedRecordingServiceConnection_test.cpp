// The interfaces the daemon publishes are the ones the packaged XML files
// document: the same methods, in the same order, with the same arguments,
// reply arguments and no-reply annotations, the same signals, and the
// service's object path, bus name and error names.
#include <gtest/gtest.h>

#include <fstream>
#include <iterator>
#include <regex>
#include <string>
#include <tuple>
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
  bool operator==(const XmlMethod&) const = default;
  friend std::ostream& operator<<(std::ostream& out, const XmlMethod& m) {
    out << m.name << '(' << m.in;
    for (const auto& name : m.inNames) out << ' ' << name;
    out << ") -> (" << m.out;
    for (const auto& name : m.outNames) out << ' ' << name;
    return out << ')' << (m.noReply ? " no reply" : "");
  }
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

std::string packaged(const std::string& file) {
  std::ifstream in(std::string(QUORVEL_SOURCE_DIR) + "/packaging/" + file);
  return {std::istreambuf_iterator<char>(in), {}};
}

// Each packaged XML file documents one interface of the object: the
// contract's, and the session listing's beside it.
TEST(ServiceInterfaceTest, PublishedInterfacesMatchThePackagedXML) {
  auto published = RCSSavedRecordingServiceConnection::serviceInterface();
  EXPECT_EQ(published.name, "org.quorvel.SavedRecordingService1");
  for (const auto& [interface, file, methodCount] :
       {std::tuple{std::string(published.name), "org.quorvel.SavedRecordingService1.xml", 10u},
        {RCSSavedRecordingServiceSessionsInterfaceName,
         "org.quorvel.SavedRecordingService1.Sessions.xml", 2u}}) {
    SCOPED_TRACE(file);
    const std::string xml = std::regex_replace(packaged(file), std::regex("<!--[\\s\\S]*?-->"), "");
    std::vector<std::string> signals;
    auto documented = methodsInXML(xml, signals);
    auto on = [&](const std::string& declaredOn) {
      return (declaredOn.empty() ? published.name : declaredOn) == interface;
    };
    std::vector<XmlMethod> methods;
    for (const auto& m : published.methods) {
      if (on(m.interface))
        methods.push_back(
            {m.name, m.inputSignature, m.outputSignature, m.inputNames, m.outputNames, m.noReply});
    }
    std::vector<std::string> publishedSignals;
    for (const auto& signal : published.signals)
      if (on(signal.interface)) publishedSignals.push_back(signal.name);
    EXPECT_EQ(documented.size(), methodCount);
    EXPECT_EQ(methods, documented);
    EXPECT_EQ(signals, publishedSignals);
    EXPECT_NE(xml.find("interface name=\"" + interface + "\""), std::string::npos);
    EXPECT_NE(xml.find(RCSSavedRecordingServiceObjectPath), std::string::npos);
  }
  const std::string contract = packaged("org.quorvel.SavedRecordingService1.xml");
  for (const char* name :
       {RCSSavedRecordingServiceMachServiceName, RCSDBusErrorMissingCompositionAVURL,
        RCSDBusErrorConflictingSession, RCSDBusErrorDeferredRequestSuperseded,
        RCSDBusErrorCompositionFailed, RCSDBusErrorGeneric}) {
    EXPECT_TRUE(contract.contains(name)) << name;
  }
}

}  // namespace
}  // namespace quorvel
