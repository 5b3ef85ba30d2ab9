#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "own_places.h"

int main(int argc, char **argv) {
  enter_own_places();
  ::testing::InitGoogleMock(&argc, argv);
  return RUN_ALL_TESTS();
}
