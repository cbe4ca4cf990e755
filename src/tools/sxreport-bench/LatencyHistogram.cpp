#include "LatencyHistogram.h"

#include <algorithm>
#include <bit>
#include <cmath>

int LatencyHistogram::bucketOf(uint64_t value) {
  constexpr uint64_t kLinear = uint64_t{1} << kSubBits;
  if (value < kLinear) return static_cast<int>(value);
  int exponent = 63 - std::countl_zero(value);  // >= kSubBits
  int sub = static_cast<int>((value >> (exponent - kSubBits)) & (kLinear - 1));
  return ((exponent - kSubBits + 1) << kSubBits) + sub;
}

uint64_t LatencyHistogram::bucketMiddle(int bucket) {
  constexpr int kLinear = 1 << kSubBits;
  if (bucket < kLinear) return static_cast<uint64_t>(bucket);
  int exponent = (bucket >> kSubBits) + kSubBits - 1;
  uint64_t sub = static_cast<uint64_t>(bucket & (kLinear - 1));
  uint64_t width = uint64_t{1} << (exponent - kSubBits);
  uint64_t low = (uint64_t{1} << exponent) + sub * width;
  return low + width / 2;
}

void LatencyHistogram::record(uint64_t nanoseconds) {
  ++buckets_[static_cast<size_t>(bucketOf(nanoseconds))];
  ++count_;
  max_ = std::max(max_, nanoseconds);
}

void LatencyHistogram::merge(const LatencyHistogram& other) {
  for (size_t i = 0; i < buckets_.size(); ++i) buckets_[i] += other.buckets_[i];
  count_ += other.count_;
  max_ = std::max(max_, other.max_);
}

uint64_t LatencyHistogram::percentileNanoseconds(double fraction) const {
  if (count_ == 0) return 0;
  auto rank = static_cast<uint64_t>(std::ceil(std::clamp(fraction, 0.0, 1.0) * count_));
  rank = std::max<uint64_t>(rank, 1);
  uint64_t seen = 0;
  for (size_t i = 0; i < buckets_.size(); ++i) {
    seen += buckets_[i];
    if (seen >= rank) return std::min(bucketMiddle(static_cast<int>(i)), max_);
  }
  return max_;
}
