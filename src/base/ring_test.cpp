// Ring against std::deque: the same random pushes at either end and pops, with
// elements that own memory, so ASan sees any slot used after its move or leaked.
#include "base/ring.h"

#include <gtest/gtest.h>

#include <deque>
#include <random>
#include <string>
#include <vector>

namespace vireo {
namespace {

TEST(Ring, BehavesAsADeque) {
  std::mt19937 random(7);
  Ring<std::string> ring;
  std::deque<std::string> model;
  for (int step = 0; step < 20000; ++step) {
    const auto op = random() % 8;
    // Long enough to live on the heap.
    const std::string value = std::to_string(step) + std::string(24, 'x');
    if (op < 3) {
      ring.push_back(value), model.push_back(value);
    } else if (op < 4) {
      ring.push_front(value), model.push_front(value);
    } else if (!model.empty()) {
      ASSERT_EQ(ring.front(), model.front());
      ring.pop_front(), model.pop_front();
    }
    ASSERT_EQ(ring.size(), model.size());
    if (step % 97 == 0) {
      ASSERT_EQ(std::vector<std::string>(ring.begin(), ring.end()),
                std::vector<std::string>(model.begin(), model.end()));
    }
  }
  Ring<std::string> moved = std::move(ring);
  EXPECT_TRUE(ring.empty());
  EXPECT_EQ(std::vector<std::string>(moved.begin(), moved.end()),
            std::vector<std::string>(model.begin(), model.end()));
  while (!moved.empty()) moved.pop_front();
  moved.push_front("again");
  EXPECT_EQ(moved.front(), "again");
}

}  // namespace
}  // namespace vireo
