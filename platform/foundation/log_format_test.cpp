#include "platform/foundation/log_format.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <fstream>
#include <map>
#include <memory>
#include <regex>
#include <set>
#include <vector>

#include "platform/foundation/data.h"
#include "platform/foundation/date.h"
#include "platform/foundation/error.h"
#include "platform/foundation/temporary_directory.h"
#include "platform/foundation/url.h"

namespace yomber {
namespace {

template <typename... Args>
std::string text(LogFormat<std::type_identity_t<Args>...> format, const Args&... args) {
  return format.render(args...);
}

TEST(LogFormatTest, PrintsIntegersByTheirConversion) {
  EXPECT_EQ(text("┏%llx", std::uint64_t{0xabcdef0123}), "┏abcdef0123");
  EXPECT_EQ(text("%llu %lu %zu %u", 18446744073709551615ULL, 7UL, sizeof(char), 4294967295U),
            "18446744073709551615 7 1 4294967295");
  EXPECT_EQ(text("%lld %ld %d", -9223372036854775807LL - 1, -5L, -7), "-9223372036854775808 -5 -7");
  EXPECT_EQ(text("%x", 255U), "ff");
  EXPECT_EQ(text("%d, %d", true, false), "1, 0");
}

TEST(LogFormatTest, PrintsRealNumbersWithTheirPrecision) {
  EXPECT_EQ(text("%.2f", 2.345678), "2.35");
  EXPECT_EQ(text("%.0f", 2.6), "3");
  EXPECT_EQ(text("%f", 0.5F), "0.500000");
  EXPECT_EQ(text("%f", -1e308).size(), 317U);
}

TEST(LogFormatTest, KeepsTextAndPercentSigns) {
  EXPECT_EQ(text("[DEBUG] ┗%llx ", 1ULL), "[DEBUG] ┗1 ");
  EXPECT_EQ(text("100%% ┣ ┳"), "100% ┣ ┳");
  EXPECT_EQ(text(""), "");
}

TEST(LogFormatTest, PrintsCAndCppStrings) {
  const std::string name = "with\0zero";
  const char* const missing = nullptr;
  EXPECT_EQ(text("%s: %s", "-[Class method:]", name), "-[Class method:]: with");
  EXPECT_EQ(text("%s", std::string("a\0b", 3)), std::string("a\0b", 3));
  EXPECT_EQ(text("%s %@", missing, missing), "(null) (null)");
  EXPECT_EQ(text("%@", std::string("%d")), "%d");
}

TEST(LogFormatTest, PrintsWhatHasADescription) {
  const NSURLRef url = NSURL::fileURLWithPath("/a b");
  const NSObjectRef object = NSData::dataWithString("\x01\xff");
  EXPECT_EQ(text("%@", url), "file:///a%20b");
  EXPECT_EQ(text("%@", object), "<01ff>");
  EXPECT_EQ(text("%@", *url), "file:///a%20b");
  EXPECT_EQ(text("%@", url.get()), "file:///a%20b");
  EXPECT_EQ(text("%@", NSDate::fromNanoseconds(0)), "1970-01-01T00:00:00Z");
}

TEST(LogFormatTest, PrintsNilAsNull) {
  EXPECT_EQ(text("%@ %@", NSErrorRef(), nullptr), "(null) (null)");
  EXPECT_EQ(text("%@", std::optional<std::string>()), "(null)");
  EXPECT_EQ(text("%@", std::optional<std::string>("there")), "there");
  EXPECT_EQ(text("%@", std::optional<NSDate>()), "(null)");
}

TEST(LogFormatTest, PrintsListsAndMappingsOnOneLine) {
  EXPECT_EQ(text("%@", std::vector<std::string>{"a", "b"}), "(a, b)");
  EXPECT_EQ(text("%@", std::vector<NSURLRef>{NSURL::fileURLWithPath("/a"), nullptr}),
            "(file:///a, (null))");
  EXPECT_EQ(text("%@", std::vector<int>{}), "()");
  EXPECT_EQ(text("%@", std::map<std::string, int>{{"a", 1}, {"b", 2}}), "{a = 1, b = 2}");
  EXPECT_EQ(text("%@", std::map<std::string, int>{}), "{}");
  EXPECT_EQ(text("%@", std::vector<std::set<unsigned>>{{1, 2}, {}}), "((1, 2), ())");
}

TEST(LogFormatTest, PrintsNumbersAsObjects) {
  EXPECT_EQ(text("%@ %@ %@", 5, 7ULL, -1L), "5 7 -1");
  EXPECT_EQ(text("%@", std::optional<std::int64_t>(3)), "3");
}

// ---- What must not compile -------------------------------------------------------------------

/// Lines of C++ and whether the compiler refused each.
class CompilationTest : public testing::Test {
 protected:
  std::set<int> linesWithErrors(const std::vector<std::string>& lines) {
    const std::string source = directory_ / "formats.cpp";
    const std::string errors = directory_ / "errors";
    {
      std::ofstream out(source);
      out << "#include \"platform/foundation/date.h\"\n#include \"platform/foundation/log.h\"\n"
          << "struct Plain {};\nvoid lines(yomber::Log& log) {\n";
      for (std::size_t i = 0; i < lines.size(); ++i) {
        out << "#line " << i + 1 << " \"line\"\n" << lines[i] << "\n";
      }
      out << "}\n";
    }
    const std::string command = std::string("LC_ALL=C " YOMBER_TEST_COMPILER) +
                                " -std=c++23 -fsyntax-only -I" YOMBER_TEST_INCLUDE_DIRECTORY " " +
                                source + " 2>" + errors;
    status_ = std::system(command.c_str());
    std::ifstream in(errors);
    messages_.assign(std::istreambuf_iterator<char>(in), {});
    std::set<int> found;
    const std::regex place("line:([0-9]+):[0-9]+: *(error|.*expansion of)");
    for (std::sregex_iterator it(messages_.begin(), messages_.end(), place), end; it != end; ++it) {
      found.insert(std::stoi((*it)[1]));
    }
    return found;
  }

  TemporaryDirectory directory_;
  int status_ = -1;
  std::string messages_;
};

TEST_F(CompilationTest, AcceptsFormatsThatFitTheirArguments) {
  const auto refused = linesWithErrors({
      R"(log_debug(log, "%llx %@ %s", std::uint64_t{1}, std::string("a"), "b");)",
      R"(log_info(log, "nothing at all");)",
      R"(log_error(log, "%d %.2f %@", 1, 2.0, yomber::NSDate::now());)",
  });
  EXPECT_EQ(status_, 0) << messages_;
  EXPECT_TRUE(refused.empty()) << messages_;
}

TEST_F(CompilationTest, RefusesFormatsThatDoNotFitTheirArguments) {
  const std::vector<std::string> wrong{
      R"(log_debug(log, "%llx", -1);)",                   // signed for unsigned
      R"(log_debug(log, "%u", std::uint64_t{1});)",       // too wide
      R"(log_debug(log, "%d", "text");)",                 // text for a number
      R"(log_debug(log, "%s", 1);)",                      // a number for text
      R"(log_debug(log, "%f", 1);)",                      // an integer for a real number
      R"(log_debug(log, "%@", Plain());)",                // has no description
      R"(log_debug(log, "%@ %@", 1);)",                   // too few
      R"(log_debug(log, "%@", 1, 2);)",                   // too many
      R"(log_debug(log, "%q", 1);)",                      // unknown
      R"(log_debug(log, "100%");)",                       // unfinished
      R"(log_debug(log, "%l@", 1);)",                     // a length where there is none
      R"(log_debug(log, "%.2d", 1);)",                    // a precision where there is none
      R"(const char* text = ""; log_debug(log, text);)",  // no literal
  };
  const auto refused = linesWithErrors(wrong);
  EXPECT_NE(status_, 0);
  for (std::size_t i = 0; i < wrong.size(); ++i) {
    EXPECT_TRUE(refused.contains(static_cast<int>(i) + 1)) << wrong[i] << "\n" << messages_;
  }
}

}  // namespace
}  // namespace yomber
