#include <gtest/gtest.h>

#include <cstdint>

#include "base/QRTFormat.h"
#include "base/QRTURL.h"
#include "base/QRTUUID.h"

namespace {

// Flags, widths and length modifiers reach the conversion; the argument is
// converted to what the conversion reads, as printf would.
TEST(QRTFormatTest, PrintfConversions) {
  EXPECT_EQ(QRTFormat("%d|%i|%3d|%-3d|%03d|%+d|% d|%.5d", -42, 7, 7, 7, 7, 7, 7, 42), "-42|7|  7|7  |007|+7| 7|00042");
  EXPECT_EQ(QRTFormat("%llu", UINT64_MAX), "18446744073709551615");
  EXPECT_EQ(QRTFormat("%lld", INT64_MIN), "-9223372036854775808");
  EXPECT_EQ(QRTFormat("%zu %zd", sizeof(int64_t), static_cast<ssize_t>(-3)), "8 -3");
  EXPECT_EQ(QRTFormat("%x %X %#x %08x %o", 255, 255, 255, 0xbeef, 8), "ff FF 0xff 0000beef 10");
  EXPECT_EQ(QRTFormat("%u %x", -1, -1), "4294967295 ffffffff");
  EXPECT_EQ(QRTFormat("%lld", UINT64_MAX), "-1");
  EXPECT_EQ(QRTFormat("%hhd %hu", 300, 70000), "44 4464");
  EXPECT_EQ(QRTFormat("%d %lld %llu", 3.9, -1e300, 1e300), "3 -9223372036854775808 18446744073709551615");
  EXPECT_EQ(QRTFormat("%d", true), "1");
  EXPECT_EQ(QRTFormat("%05.2f %.3e %G %a %Lf %.1f", 3.14159, 1234.5, 1e-10, 1.0, 0.5, 2),
            "03.14 1.234e+03 1E-10 0x1p+0 0.500000 2.0");
  EXPECT_EQ(QRTFormat("%c%c%3c|%-2c|", 'o', 'k', 'x', 'y'), "ok  x|y |");
  EXPECT_EQ(QRTFormat("%s|%-5s|%5s|%.2s", "abc", "ab", "ab", "abcdef"), "abc|ab   |   ab|ab");
  EXPECT_EQ(QRTFormat("%s", static_cast<const char*>(nullptr)), "(null)");
  EXPECT_EQ(QRTFormat("%s %d", std::string("text"), std::string("obj")), "text obj");
  EXPECT_EQ(QRTFormat("%p %p", reinterpret_cast<const void*>(0x1234), static_cast<const void*>(nullptr)), "0x1234 0x0");
  EXPECT_EQ(QRTFormat("100%% sure, %5%"), "100% sure, %");
  EXPECT_EQ(QRTFormat("%*d|%-*d|%.*s", 4, 1, 3, 2, 2, "abcdef"), "   1|2  |ab");
  EXPECT_EQ(QRTFormat("%*d|", -3, 5), "5  |");
  // Width and precision are bounded whatever the format asks for.
  EXPECT_EQ(QRTFormat("%999999999d", 1).size(), 4096u);
  EXPECT_LT(QRTFormat("%.999999999f", 1e308).size(), 5000u);
}

struct Described {
  std::string description() const { return "described"; }
};

TEST(QRTFormatTest, ObjectConversionsBadFormatsAndMissingArguments) {
  EXPECT_EQ(QRTFormat("%@ %@ %@", std::string("s"), "c", nullptr), "s c (null)");
  EXPECT_EQ(QRTFormat("%@ %@ %@ %@", 42, UINT64_MAX, 0.5, -3), "42 18446744073709551615 0.5 -3");
  EXPECT_EQ(QRTFormat("%@", plist::Value(plist::Array{"a", "b"})), "( a, b )");  // the rest: PlistDescribe
  EXPECT_EQ(QRTFormat("[%10@] [%-4@]", std::string("right"), std::string("l")), "[     right] [l   ]");
  std::optional<std::string> none, some = "here";
  EXPECT_EQ(QRTFormat("%@ %@", none, some), "(null) here");
  auto shared = std::make_shared<Described>();
  EXPECT_EQ(QRTFormat("%@ %s %@ %@", Described(), Described(), shared, std::shared_ptr<Described>()),
            "described described described (null)");

  EXPECT_EQ(QRTFormat("%d %s %@ %f %x|%c|%p"), "0 (null) (null) 0.000000 0||0x0");
  EXPECT_EQ(QRTFormat("%*d", 5), "    0");
  EXPECT_EQ(QRTFormat("%n %k %1$s", 1), "%n %k %1$s");
  EXPECT_EQ(QRTFormat("tail %-5"), "tail %-5");
  EXPECT_EQ(QRTFormat("50%"), "50%");
  EXPECT_EQ(QRTFormatArgs(nullptr, {1}), "");
  EXPECT_EQ(QRTFormat("only %d", 1, 2, 3), "only 1");
}

}  // namespace
