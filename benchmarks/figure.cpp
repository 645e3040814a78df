#include "benchmarks/figure.h"

#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <iostream>

#include <nlohmann/json.hpp>

namespace yomber::bench {

Figure compared(std::string name, double value, std::string unit, std::string yardstick,
                double yardstickValue, std::string goal,
                const std::function<bool(double ratio)>& isReached) {
  Figure figure;
  figure.name = std::move(name);
  figure.value = value;
  figure.unit = std::move(unit);
  figure.yardstick = std::move(yardstick);
  figure.yardstickValue = yardstickValue;
  figure.ratio = yardstickValue == 0 ? 0 : value / yardstickValue;
  figure.goal = std::move(goal);
  figure.reached = isReached(figure.ratio);
  return figure;
}

void Repeated::add(double value, double yardstickValue) {
  values_.push_back(value);
  yardsticks_.push_back(yardstickValue);
  ratios_.push_back(yardstickValue == 0 ? 0 : value / yardstickValue);
}

Figure Repeated::figure(std::string name, std::string unit, std::string yardstick, std::string goal,
                        const std::function<bool(double ratio)>& isReached) const {
  Figure figure;
  figure.name = std::move(name);
  figure.value = percentile(values_, 0.5);
  figure.unit = std::move(unit);
  figure.yardstick = std::move(yardstick);
  figure.yardstickValue = percentile(yardsticks_, 0.5);
  figure.ratio = percentile(ratios_, 0.5);
  figure.goal = std::move(goal);
  figure.reached = isReached(figure.ratio);
  return figure;
}

void print(const Figure& figure) {
  if (std::getenv("YOMBER_BENCH_JSON") != nullptr) {
    nlohmann::ordered_json json{
        {"name", figure.name}, {"value", figure.value}, {"unit", figure.unit}};
    json["yardstick"] = nullptr;
    json["ratio"] = nullptr;
    json["goal"] = nullptr;
    if (!figure.yardstick.empty()) {
      json["yardstick"] = {{"name", figure.yardstick}, {"value", figure.yardstickValue}};
      json["ratio"] = figure.ratio;
    }
    if (!figure.goal.empty()) {
      json["goal"] = figure.goal;
      json["reached"] = figure.reached;
    }
    std::cout << json.dump() << std::endl;
    return;
  }
  std::printf("%-46s %14.6g %-10s", figure.name.c_str(), figure.value, figure.unit.c_str());
  if (!figure.yardstick.empty()) {
    std::printf("  %s: %.6g, ratio %.3g", figure.yardstick.c_str(), figure.yardstickValue,
                figure.ratio);
  }
  if (!figure.goal.empty())
    std::printf("  (goal: %s: %s)", figure.goal.c_str(),
                figure.reached ? "reached" : "NOT REACHED");
  std::printf("\n");
  std::fflush(stdout);
}

double secondsFor(const std::function<void()>& work) {
  const auto start = std::chrono::steady_clock::now();
  work();
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

double percentile(std::vector<double> values, double share) {
  if (values.empty()) return 0;
  const auto last = static_cast<double>(values.size() - 1);
  const auto index = static_cast<std::ptrdiff_t>(std::lround(last * share));
  std::ranges::nth_element(values, values.begin() + index);
  return values[static_cast<std::size_t>(index)];
}

std::size_t sizeFromEnvironment(const char* name, std::size_t otherwise) {
  const char* text = std::getenv(name);
  return text == nullptr ? otherwise : std::strtoull(text, nullptr, 10);
}

}  // namespace yomber::bench
