// Code-signature reading on real images signed by the build.
#include <gtest/gtest.h>

#include "platform/win_error.h"
#include "security/images.h"
#include "security/signature.h"
#include "support/log_capture.h"

namespace {

using security_test::image_path;
using test_support::find_lines;

TEST(signature_test, verification_of_each_kind_of_image) {
  const struct {
    const wchar_t* image;
    bool trusted;
    std::uint32_t code;  // ~0u: any failure
  } cases[] = {
      {L"child_a", true, 0},
      {L"child_unsigned", false, 0},  // a verdict, not an error
      {L"child_tampered", false, 0x80096010u},  // TRUST_E_BAD_DIGEST
      {L"no_such_image", false, ~0u},
  };
  for (const auto& c : cases) {
    std::error_code code = winapi::make_win_error(1);
    EXPECT_EQ(c.trusted, is_trusted(image_path(c.image), code)) << c.image;
    if (c.code == ~0u) {
      EXPECT_TRUE(code) << c.image;
    } else {
      EXPECT_EQ(c.code, static_cast<std::uint32_t>(code.value())) << c.image;
    }
  }
  std::error_code code;
  const signature none = read_signature(image_path(L"no_such_image"), code);
  EXPECT_TRUE(code);
  EXPECT_TRUE(none.serial_number.empty() && none.issuer.empty() && none.subject.empty());
}

TEST(signature_test, signer_fields_read_back_exactly) {
  std::error_code code;
  // Most significant byte first, two lower-case digits per byte, zero bytes
  // and bytes below 0x10 kept.
  const auto serial = get_signature(image_path(L"child_serial"), code);
  ASSERT_TRUE(serial.has_value()) << code.value();
  EXPECT_EQ(serial->serial_number, VORBEL_SIGNER_SERIAL_NUMBER);
  EXPECT_EQ(serial->subject, VORBEL_SIGNER_SERIAL_SUBJECT);
  EXPECT_EQ(serial->issuer, VORBEL_ROOT_SUBJECT);

  // The test program itself is signed by signer A, like child_a; the
  // tampered copy still names its signer: verification, not reading, judges it.
  const auto current = get_current_signature();
  ASSERT_TRUE(current.has_value()) << test_support::dump_log();
  EXPECT_FALSE(current->subject.empty());
  EXPECT_EQ(current->serial_number, VORBEL_SIGNER_A_SERIAL);
  for (const wchar_t* image : {L"child_a", L"child_tampered"}) {
    const auto found = get_signature(image_path(image), code);
    ASSERT_TRUE(found.has_value()) << code.value();
    EXPECT_EQ(found->serial_number, current->serial_number) << image;
    EXPECT_EQ(found->subject, current->subject) << image;
    EXPECT_EQ(found->issuer, current->issuer) << image;
  }
}

TEST(signature_test, absent_signatures_give_the_code_and_a_warning) {
  test_support::clear_log();
  std::error_code code;
  EXPECT_FALSE(get_signature(image_path(L"child_unsigned"), code).has_value());
  EXPECT_EQ(static_cast<std::uint32_t>(code.value()), 0x80092009u);  // CryptQueryObject: not found
  EXPECT_EQ(&code.category(), &winapi::win_error_category());
  const auto lines = find_lines(L"get_signature", L"get_signature err=0x80092009 ");
  ASSERT_EQ(lines.size(), 1u) << test_support::dump_log();
  EXPECT_EQ(lines[0].level, 8u);
  const std::string message = code.message();
  EXPECT_EQ(lines[0].text, L"get_signature err=0x80092009 " + std::wstring(message.begin(), message.end()));
  EXPECT_EQ(find_lines(L"get_signature", L"-> get_signature()").size(), 1u);

  // A certificate without a subject name.
  EXPECT_FALSE(get_signature(image_path(L"child_noname"), code).has_value());
  EXPECT_EQ(code.value(), 1168);
  EXPECT_EQ(find_lines(L"get_signature", L"get_signature err=0x490 ").size(), 1u) << test_support::dump_log();
}

}  // namespace
