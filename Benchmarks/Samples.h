// Times of single operations, and what is made of them.
#pragma once

#include <algorithm>
#include <chrono>
#include <cstddef>
#include <vector>

class Samples {
 public:
  template <typename Operation>
  void time(Operation&& operation) {
    const auto start = std::chrono::steady_clock::now();
    operation();
    const std::chrono::duration<double, std::micro> taken =
        std::chrono::steady_clock::now() - start;
    microseconds_.push_back(taken.count());
  }

  // The value below which this part of the samples lies, in microseconds.
  double percentile(double part) {
    const auto rank = static_cast<ptrdiff_t>(part * static_cast<double>(microseconds_.size() - 1));
    std::nth_element(microseconds_.begin(), microseconds_.begin() + rank, microseconds_.end());
    return microseconds_[static_cast<size_t>(rank)];
  }
  double median() { return percentile(0.5); }

 private:
  std::vector<double> microseconds_;
};
