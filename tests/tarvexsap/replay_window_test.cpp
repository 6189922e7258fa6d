// The server's replay window in isolation: slot reuse as the window slides, and the extremes
// of the 64-bit sequence space.
#include "tarvexsap/tsap_replay_window.h"

#include <gtest/gtest.h>

#include <limits>

namespace {

TEST(ReplayWindowTest, SlotsAreReleasedAsTheWindowSlides) {
    tsap::ReplayWindow window;
    for (uint64_t seq = 1; seq <= 1024; ++seq) {
        ASSERT_TRUE(window.accept(seq));
    }
    // 1025 shares a slot with 1 and pushes 1 out of the window.
    EXPECT_TRUE(window.accept(1025));
    EXPECT_FALSE(window.accept(1));
    for (uint64_t seq = 2; seq <= 1025; ++seq) {
        EXPECT_FALSE(window.accept(seq)) << seq;
    }
    // A gap inside the window stays usable after a slide over it.
    tsap::ReplayWindow gappy;
    EXPECT_TRUE(gappy.accept(10));
    EXPECT_TRUE(gappy.accept(1030)); // window now 7..1030; slot of 6 reused by 1030
    EXPECT_TRUE(gappy.accept(7));
    EXPECT_FALSE(gappy.accept(6));
    EXPECT_FALSE(gappy.accept(10));
    EXPECT_TRUE(gappy.accept(11));
}

TEST(ReplayWindowTest, JumpOfAWholeWindowForgetsEverything) {
    tsap::ReplayWindow window;
    EXPECT_TRUE(window.accept(100));
    EXPECT_TRUE(window.accept(100 + 1024)); // 100 falls just out
    EXPECT_FALSE(window.accept(100));
    EXPECT_TRUE(window.accept(101));
    EXPECT_TRUE(window.accept(100 + 5000));
    EXPECT_FALSE(window.accept(101));
    EXPECT_TRUE(window.accept(100 + 5000 - 1));
    EXPECT_EQ(window.highest(), 5100u);
}

TEST(ReplayWindowTest, ExtremesOfTheSequenceSpace) {
    constexpr uint64_t top = std::numeric_limits<uint64_t>::max();
    tsap::ReplayWindow window;
    EXPECT_FALSE(window.accept(0));
    EXPECT_TRUE(window.accept(top));
    EXPECT_FALSE(window.accept(top));
    EXPECT_TRUE(window.accept(top - 1023));
    EXPECT_FALSE(window.accept(top - 1024));
    EXPECT_FALSE(window.accept(1));
    EXPECT_FALSE(window.accept(0));
}

} // namespace
