// The installed interface files against what the running daemon's object
// answers to Introspect, compared member by member rather than as text.
#include <systemd/sd-bus.h>

#include <filesystem>
#include <map>
#include <set>
#include <stdexcept>
#include <string_view>

#include "platform/dbus/bus.h"
#include "service_fixture.h"

namespace vireo::itest {
namespace {

// Each interface of an introspection document as one line per member: methods
// with their arguments' directions, types and names, signals, properties and
// annotations. Reads the XML subset these documents use (elements with quoted
// attributes, comments, declarations); throws on what it cannot read.
using Description = std::map<std::string, std::set<std::string>>;

Description describe(std::string_view xml) {
  Description out;
  std::string interface, member, line;
  auto fail = [](const char* what) { throw std::runtime_error(what); };
  for (std::size_t i = xml.find('<'); i != std::string_view::npos; i = xml.find('<', i)) {
    std::size_t end = xml.substr(i, 4) == "<!--" ? xml.find("-->", i) : xml.find('>', i);
    if (end == std::string_view::npos) fail("unterminated tag or comment");
    std::string_view tag = xml.substr(i + 1, end - i - 1);
    i = end + 1;
    if (tag.starts_with('!') || tag.starts_with('?')) continue;
    if (tag.starts_with('/')) {
      if (tag.substr(1) == member) out[interface].insert(line), member.clear();
      continue;
    }
    const bool empty = tag.ends_with('/');
    if (empty) tag.remove_suffix(1);
    std::map<std::string, std::string> a;
    std::size_t p = tag.find_first_of(" \t\r\n");
    const std::string name(tag.substr(0, p));
    while (p != std::string_view::npos && (p = tag.find_first_not_of(" \t\r\n", p)) != std::string_view::npos) {
      std::size_t eq = tag.find('=', p), close = eq == std::string_view::npos ? eq : tag.find(tag[eq + 1], eq + 2);
      if (close == std::string_view::npos || (tag[eq + 1] != '"' && tag[eq + 1] != '\'')) fail("bad attribute");
      a[std::string(tag.substr(p, eq - p))] = tag.substr(eq + 2, close - eq - 2);
      p = close + 1;
    }
    if (name == "interface") {
      interface = a["name"];
      out[interface];
    } else if (name == "method" || name == "signal" || name == "property") {
      member = name;
      line = name + " " + a["name"] + (name == "property" ? " " + a["type"] + " " + a["access"] : "");
      if (empty) out[interface].insert(line), member.clear();
    } else if (name == "arg") {
      std::string direction = member == "signal" ? "" : a["direction"].empty() ? "in" : a["direction"];
      line += " [" + direction + " " + a["type"] + " " + a["name"] + "]";
    } else if (name == "annotation") {
      line += " {" + a["name"] + "=" + a["value"] + "}";
    }
  }
  return out;
}

class IntrospectionTest : public ServiceTest {};

TEST_F(IntrospectionTest, InstalledInterfaceFilesDescribeTheLiveObject) {
  dbus::BusRef bus;
  ASSERT_GE(sd_bus_new(bus.out()), 0);
  ASSERT_GE(sd_bus_set_address(bus.get(), busAddress_.c_str()), 0);
  ASSERT_GE(sd_bus_set_bus_client(bus.get(), 1), 0);
  ASSERT_GE(sd_bus_start(bus.get()), 0);
  dbus::BusError error;
  dbus::MessageRef reply;
  ASSERT_GE(sd_bus_call_method(bus.get(), "com.orvane.vireo.Reporting1", "/com/orvane/vireo/Reporting1",
                               "org.freedesktop.DBus.Introspectable", "Introspect", error.get(), reply.out(), ""),
            0)
      << error.message();
  const char* xml = nullptr;
  ASSERT_GE(sd_bus_message_read(reply.get(), "s", &xml), 0);
  Description live = describe(xml);
  std::erase_if(live, [](const auto& entry) { return entry.first.starts_with("org.freedesktop.DBus."); });

  Description installed;
  for (const auto& file : std::filesystem::directory_iterator(VIREO_DATA_DIR)) {
    if (file.path().extension() != ".xml") continue;
    Description one = describe(readFile(file.path()));
    ASSERT_EQ(one.size(), 1u) << file.path() << ": one interface per file";
    EXPECT_EQ(file.path().stem(), one.begin()->first) << "named after its interface";
    installed.merge(one);
  }
  EXPECT_EQ(installed.size(), 3u);
  EXPECT_TRUE(installed["com.orvane.vireo.Reporting1"].contains(
      "method CreateReportingSession [in x reporterID] [out b success]"));
  EXPECT_EQ(installed, live) << xml;
}

}  // namespace
}  // namespace vireo::itest
