// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/net/linux/CellularRule.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>

#include <cstring>
#include <filesystem>
#include <fstream>

#include "platform/net/fakes/PrivateNetwork.h"
#include "platform/net/linux/Routes.h"

namespace brenvik {
namespace {

sockaddr_storage addressOf(const char* text, unsigned scope = 0) {
  sockaddr_storage storage{};
  sockaddr_in v4{};
  if (::inet_pton(AF_INET, text, &v4.sin_addr) == 1) {
    v4.sin_family = AF_INET;
    std::memcpy(&storage, &v4, sizeof v4);
    return storage;
  }
  sockaddr_in6 v6{};
  EXPECT_EQ(::inet_pton(AF_INET6, text, &v6.sin6_addr), 1) << text;
  v6.sin6_family = AF_INET6;
  v6.sin6_scope_id = scope;
  std::memcpy(&storage, &v6, sizeof v6);
  return storage;
}

class CellularRuleTest : public testing::Test {
 protected:
  void SetUp() override {
    if (!network.isMade()) GTEST_SKIP() << "no permission to make a network namespace";
    std::string pattern = testing::TempDir() + "cellularruleXXXXXX";
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    folder = pattern;
    files.interfaces = folder / "net";
    files.nameServers = folder / "resolv.conf";
    files.hosts = folder / "hosts";
    ASSERT_TRUE(network.ip("link set lo up"));
  }
  void TearDown() override {
    if (!folder.empty()) std::filesystem::remove_all(folder);
  }
  void write(const std::filesystem::path& path, const std::string& text) {
    std::filesystem::create_directories(path.parent_path());
    std::ofstream(path) << text;
  }
  // An interface with a far end and the address 10.0.N.1/24.
  void addInterface(const std::string& name, int number) {
    const std::string n = std::to_string(number);
    ASSERT_TRUE(network.ip("link add " + name + " type veth peer name far" + n));
    ASSERT_TRUE(network.ip("address add 10.0." + n + ".1/24 dev " + name));
    ASSERT_TRUE(network.ip("link set " + name + " up"));
    ASSERT_TRUE(network.ip("link set far" + n + " up"));
  }
  // The interface, or "cellular" or "none".
  std::string chosenFor(const sockaddr_storage& storage) {
    ConnectionWay way;
    network.run([&] { way = routeTo(reinterpret_cast<const sockaddr&>(storage), files); });
    if (way.kind == ConnectionWay::Kind::open) return way.interfaceName;
    EXPECT_EQ(way.interfaceName, "");
    return way.kind == ConnectionWay::Kind::cellular ? "cellular" : "none";
  }
  std::string chosenFor(const char* address) { return chosenFor(addressOf(address)); }
  unsigned indexOf(const char* name) {
    unsigned index = 0;
    network.run([&] { index = ::if_nametoindex(name); });
    return index;
  }
  bool mayLookUp(const char* host) {
    bool may = false;
    network.run([&] { may = mayLookUpName(host, files); });
    return may;
  }

  PrivateNetwork network;
  std::filesystem::path folder;
  CellularRuleFiles files;
};

TEST_F(CellularRuleTest, AnInterfaceIsCellularByItsNameOrItsDeviceType) {
  write(files.interfaces + "/wwan0/uevent", "DEVTYPE=wwan\nINTERFACE=wwan0\nIFINDEX=7\n");
  write(files.interfaces + "/wlan0/uevent", "DEVTYPE=wlan\nINTERFACE=wlan0\n");
  EXPECT_TRUE(isCellularInterface("pdp_ip0", files));
  EXPECT_TRUE(isCellularInterface("pdp_ip3", files));
  EXPECT_TRUE(isCellularInterface("wwan0", files));
  EXPECT_FALSE(isCellularInterface("wlan0", files));
  EXPECT_FALSE(isCellularInterface("wwan1", files)) << "a name alone says nothing";
  EXPECT_FALSE(isCellularInterface("xpdp_ip0", files));
}

TEST_F(CellularRuleTest, TheInterfaceOfTheRouteIsChosenAndACellularOneIsNot) {
  addInterface("wifi0", 1);
  addInterface("pdp_ip0", 2);
  ASSERT_TRUE(network.ip("route add default via 10.0.2.2"));
  EXPECT_EQ(chosenFor("10.0.1.7"), "wifi0");
  EXPECT_EQ(chosenFor("10.0.2.7"), "cellular");
  EXPECT_EQ(chosenFor("203.0.113.9"), "cellular") << "the default route is cellular";
  EXPECT_EQ(chosenFor("127.0.0.1"), "lo");
  EXPECT_EQ(chosenFor("10.0.2.1"), "lo") << "our own address never leaves the machine";
  EXPECT_EQ(chosenFor("::ffff:10.0.1.7"), "wifi0");
  EXPECT_EQ(chosenFor("::ffff:10.0.2.7"), "cellular");
}

TEST_F(CellularRuleTest, RoutesOfIpVersion6AreAskedForTooAndAScopeNamesTheInterface) {
  if (!network.ip("-6 address add 2001:db8::1/128 dev lo nodad 2> /dev/null")) GTEST_SKIP() << "no IPv6 here";
  addInterface("wifi0", 1);
  addInterface("pdp_ip0", 2);
  ASSERT_TRUE(network.ip("-6 address add 2001:db8:1::1/64 dev wifi0 nodad"));
  ASSERT_TRUE(network.ip("-6 address add 2001:db8:2::1/64 dev pdp_ip0 nodad"));
  EXPECT_EQ(chosenFor("2001:db8:1::2"), "wifi0");
  EXPECT_EQ(chosenFor("2001:db8:2::2"), "cellular");
  EXPECT_EQ(chosenFor("::1"), "lo");
  EXPECT_EQ(chosenFor(addressOf("fe80::1", indexOf("wifi0"))), "wifi0");
  EXPECT_EQ(chosenFor(addressOf("fe80::1", indexOf("pdp_ip0"))), "cellular");
}

TEST_F(CellularRuleTest, WithoutARouteNoInterfaceIsChosen) {
  EXPECT_EQ(chosenFor("203.0.113.9"), "none");
  sockaddr_storage local{};
  local.ss_family = AF_UNIX;
  EXPECT_EQ(chosenFor(local), "none");
}

TEST_F(CellularRuleTest, NamesAreNotLookedUpWhileAllRoutesAreCellular) {
  EXPECT_TRUE(mayLookUp("server.example")) << "no route at all: a resolver on this machine may answer";
  addInterface("pdp_ip0", 2);
  ASSERT_TRUE(network.ip("route add default via 10.0.2.2"));
  EXPECT_FALSE(mayLookUp("server.example"));
  write(files.hosts, "10.0.2.7 server.example\n");
  EXPECT_FALSE(mayLookUp("server.example")) << "a known address does not help where only cellular leads out";
  addInterface("wifi0", 1);
  EXPECT_TRUE(mayLookUp("server.example"));
  ASSERT_TRUE(network.ip("link set wifi0 down"));
  EXPECT_FALSE(mayLookUp("server.example"));
}

TEST_F(CellularRuleTest, LinkLocalAndDeadRoutesAreNoWayOut) {
  addInterface("pdp_ip0", 2);
  ASSERT_TRUE(network.ip("link add wifi0 type veth peer name far1"));
  ASSERT_TRUE(network.ip("link set wifi0 up"));
  ASSERT_TRUE(network.ip("link set far1 up"));  // an IPv6 link-local route of its own comes with it
  ASSERT_TRUE(network.ip("address add 169.254.7.7/16 dev wifi0"));
  ASSERT_TRUE(network.ip("-6 route add febf::/16 dev wifi0"));  // the last of fe80::/10
  EXPECT_FALSE(mayLookUp("server.example"));
  ASSERT_TRUE(network.ip("-6 route add fec0::/16 dev wifi0"));
  EXPECT_TRUE(mayLookUp("server.example"));
}

TEST_F(CellularRuleTest, EveryHopOfAMultipathRouteCounts) {
  addInterface("pdp_ip0", 2);
  addInterface("wifi0", 1);
  ASSERT_TRUE(network.ip("address del 10.0.1.1/24 dev wifi0"));
  EXPECT_FALSE(mayLookUp("server.example"));
  ASSERT_TRUE(network.ip("route add 198.51.100.0/24 nexthop dev pdp_ip0 nexthop dev wifi0"));
  EXPECT_TRUE(mayLookUp("server.example"));
}

TEST_F(CellularRuleTest, NamesAreNotLookedUpAtANameServerBehindCellular) {
  addInterface("wifi0", 1);
  addInterface("pdp_ip0", 2);
  ASSERT_TRUE(network.ip("route add default via 10.0.2.2"));
  write(files.nameServers, "# nameserver 10.0.2.2\nnameserver 10.0.1.2\noptions timeout:1\n");
  EXPECT_TRUE(mayLookUp("server.example"));
  write(files.nameServers, "nameserver 10.0.1.2\nnameserver 203.0.113.53\n");
  EXPECT_FALSE(mayLookUp("server.example"));
  write(files.hosts, "10.0.1.7 other.example Server.Example # near\n");
  EXPECT_TRUE(mayLookUp("server.example")) << "the hosts file has it, so no server is asked";
  EXPECT_FALSE(mayLookUp("near"));
  write(files.nameServers, "nameserver 127.0.0.53\nnameserver nonsense\nnameserver\n");
  EXPECT_TRUE(mayLookUp("unlisted.example"));
}

TEST_F(CellularRuleTest, ATableOfManyRoutesIsReadToItsEnd) {
  addInterface("pdp_ip0", 2);
  const auto batch = folder / "routes";
  std::ofstream routes(batch);
  for (int i = 0; i < 2000; ++i) {
    routes << "route add 10." << 100 + i / 250 << "." << i % 250 << ".0/24 dev pdp_ip0\n";
  }
  routes.close();
  ASSERT_TRUE(network.ip("-batch " + batch.string()));
  EXPECT_FALSE(mayLookUp("server.example"));
  addInterface("wifi0", 1);
  ASSERT_TRUE(network.ip("route flush dev wifi0"));
  ASSERT_TRUE(network.ip("route add 192.168.200.0/24 dev wifi0 table 77"));
  EXPECT_TRUE(mayLookUp("server.example")) << "other tables count";
}

}  // namespace
}  // namespace brenvik
