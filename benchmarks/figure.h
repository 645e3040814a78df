#pragma once

#include <functional>
#include <string>
#include <vector>

namespace yomber::bench {

/// One measured figure, and the yardstick that was measured beside it in the same run.
struct Figure {
  std::string name;
  double value = 0;
  std::string unit;
  std::string yardstick;      ///< what it is compared with; empty: nothing
  double yardstickValue = 0;  ///< in the same unit
  double ratio = 0;           ///< value / yardstickValue
  std::string goal;           ///< what the ratio or value should reach; empty: reported only
  bool reached = true;
};

/// A figure compared with a yardstick: `reached` says whether the ratio is what it should be.
[[nodiscard]] Figure compared(std::string name, double value, std::string unit,
                              std::string yardstick, double yardstickValue, std::string goal,
                              const std::function<bool(double ratio)>& isReached);

/// What was measured several times, each time beside its yardstick, so that whatever else the
/// machine did hit both alike.
class Repeated {
 public:
  void add(double value, double yardstickValue);
  /// The medians; the ratio is the median of the rounds' own ratios.
  [[nodiscard]] Figure figure(std::string name, std::string unit, std::string yardstick,
                              std::string goal,
                              const std::function<bool(double ratio)>& isReached) const;

 private:
  std::vector<double> values_;
  std::vector<double> yardsticks_;
  std::vector<double> ratios_;
};

/// Prints the figure: one JSON object a line when YOMBER_BENCH_JSON is set, else a line for people.
void print(const Figure& figure);

/// Seconds that `work` takes.
[[nodiscard]] double secondsFor(const std::function<void()>& work);

/// The value below which `share` (0…1) of the values lie.
[[nodiscard]] double percentile(std::vector<double> values, double share);

/// The number in an environment variable, or `otherwise`.
[[nodiscard]] std::size_t sizeFromEnvironment(const char* name, std::size_t otherwise);

}  // namespace yomber::bench
