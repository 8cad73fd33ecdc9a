// Base fixture of the kernel tests: skips visibly without root or namespace
// support, builds the topology of netns_env.h and points ORVI_ROOT at a
// fresh appliance root (where kernel-mode applies keep their last good batch).
#ifndef TC_TESTS_KERNEL_KERNEL_FIXTURE_H
#define TC_TESTS_KERNEL_KERNEL_FIXTURE_H

#include <stdlib.h>

#include <cstdio>
#include <memory>

#include <gtest/gtest.h>

#include "netns_env.h"

namespace kerneltest {

class KernelTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string why = KernelTestsUnavailable();
    if (why.empty()) {
      topo_.reset(new Topology);
      if (!topo_->Create(&why)) {
        why = "no usable network namespaces: " + why;
      } else {
        why = topo_->TrafficControlUnavailable();
        if (!why.empty()) why = "the kernel lacks HTB, u32 or pfifo: " + why;
      }
    }
    if (!why.empty()) {
      std::fprintf(stderr, "SKIPPED: %s\n", why.c_str());
      topo_.reset();  // removes whatever was made
      GTEST_SKIP() << "SKIPPED: " << why;
    }
    root_.reset(new ApplianceRoot({{"br0", 125000}}));
    ASSERT_TRUE(root_->ok());
    setenv("ORVI_ROOT", root_->dir().c_str(), 1);
  }
  void TearDown() override {
    unsetenv("ORVI_ROOT");
    root_.reset();
    topo_.reset();
  }

  Topology& topo() { return *topo_; }
  const ApplianceRoot& root() { return *root_; }

 private:
  std::unique_ptr<Topology> topo_;
  std::unique_ptr<ApplianceRoot> root_;
};

}  // namespace kerneltest

#endif
