#include <gtest/gtest.h>
#include "ORVI.Core.Network.TrafficControl.h"
#include "fake_platform.h"
TEST(Frame, Builds) { fake::Reset(); }
