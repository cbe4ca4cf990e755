// Reply latencies of a benchmark run, kept as a log-linear histogram so that ten million
// samples cost a few kilobytes: 32 buckets per power of two, so a percentile is off by at most
// about 3 %. The maximum is kept exactly. Not thread-safe; one per client, merged at the end.
#pragma once

#include <array>
#include <cstdint>

class LatencyHistogram {
 public:
  void record(uint64_t nanoseconds);
  void merge(const LatencyHistogram& other);

  uint64_t count() const { return count_; }
  uint64_t maxNanoseconds() const { return max_; }
  // The value below which `fraction` (0..1) of the samples lie; 0 when there are none.
  uint64_t percentileNanoseconds(double fraction) const;

 private:
  static constexpr int kSubBits = 5;
  static constexpr int kBuckets = (64 - kSubBits + 1) << kSubBits;

  static int bucketOf(uint64_t value);
  static uint64_t bucketMiddle(int bucket);

  std::array<uint64_t, kBuckets> buckets_{};
  uint64_t count_ = 0;
  uint64_t max_ = 0;
};
