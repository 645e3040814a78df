#pragma once

namespace yomber {

/// A width and a height, in the unit of whoever uses it.
struct CGSize {
  double width = 0;
  double height = 0;

  friend bool operator==(const CGSize&, const CGSize&) = default;
};

}  // namespace yomber
