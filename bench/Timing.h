#pragma once

#include <algorithm>
#include <chrono>
#include <functional>
#include <vector>

// What the benchmarks that do their own timing share.

inline double seconds(const std::function<void()>& work) {
    const auto begin = std::chrono::steady_clock::now();
    work();
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - begin).count();
}

inline double median(std::vector<double> values) {
    std::ranges::sort(values);
    return values[values.size() / 2];
}
