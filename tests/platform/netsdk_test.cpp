#include "sdk_network.h"

#include <unistd.h>

#include <gtest/gtest.h>

#include "olibc.h"
#include "tmp_root.h"

namespace {

Json::Value Iface(const char* id, bool bridge, int speed, bool up) {
  Json::Value v(Json::objectValue);
  v["id"] = id;
  v["bridge"] = bridge;
  v["speed_mbps"] = speed;
  v["up"] = up;
  return v;
}

TEST(EnumInterfacesStatus, ReadsTheSimulatedSysfs) {
  TmpRoot root;
  root.Write("sys/class/net/eth0/speed", "1000\n");
  root.Write("sys/class/net/eth0/operstate", "up\n");
  root.MkDir("sys/class/net/br0/bridge");
  root.Write("sys/class/net/br0/operstate", "unknown\n");
  root.Write("sys/class/net/wan0/speed", "-1\n");
  root.Write("sys/class/net/wan0/operstate", "down\n");
  root.Write("sys/class/net/eth1/speed", "10G\n");
  root.Write("sys/class/net/eth2/speed", "0\n");
  root.Write("sys/class/net/eth3/speed", "99999999999\n");
  root.Write("sys/class/net/bonding_masters", "");
  // Real entries are symlinks to the device directories.
  root.Write("sys/devices/virtual/net/veth0/speed", " 10000 \n");
  ASSERT_EQ(symlink("../../devices/virtual/net/veth0", root.Path("sys/class/net/veth0").c_str()),
            0);

  Json::Value got(Json::objectValue);  // whatever the caller passes becomes the array
  got["junk"] = 1;
  ASSERT_TRUE(SDK::Network::EnumInterfacesStatus(got));

  Json::Value want(Json::arrayValue);
  want.append(Iface("br0", true, -1, true));
  want.append(Iface("eth0", false, 1000, true));
  want.append(Iface("eth1", false, -1, false));
  want.append(Iface("eth2", false, -1, false));
  want.append(Iface("eth3", false, -1, false));
  want.append(Iface("veth0", false, 10000, false));
  want.append(Iface("wan0", false, -1, false));
  EXPECT_EQ(got, want) << got.toStyledString();
}

TEST(EnumInterfacesStatus, MissingDirectoryFailsWithAnEmptyArray) {
  TmpRoot root;
  Json::Value got(Json::arrayValue);
  got.append("stale");
  OLIBCErrSetEx(0, "", 0);
  EXPECT_FALSE(SDK::Network::EnumInterfacesStatus(got));
  EXPECT_TRUE(got.isArray());
  EXPECT_EQ(got.size(), 0u);
  EXPECT_EQ(OLIBCErrGet(), OLIBC_ERR_IO);
  EXPECT_STREQ(OLIBCErrorGetFile(), "netsdk.cpp");
}

}  // namespace
