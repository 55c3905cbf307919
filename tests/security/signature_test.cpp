// Code-signature reading and verification on real images signed by the build.
#include <gtest/gtest.h>

#include "platform/win_error.h"
#include "security/images.h"
#include "security/signature.h"

namespace {

using security_test::image_path;

TEST(signature_test, verification_and_the_signer_fields_of_each_kind_of_image) {
  const struct {
    const wchar_t* image;
    bool trusted;
    std::uint32_t code;
  } cases[] = {
      {L"child_a", true, 0},
      {L"child_unsigned", false, 0},            // a verdict, not an error
      {L"child_tampered", false, 0x80096010u},  // TRUST_E_BAD_DIGEST
  };
  std::error_code code;
  for (const auto& c : cases) {
    code = winapi::make_win_error(1);
    EXPECT_EQ(c.trusted, is_trusted(image_path(c.image), code)) << c.image;
    EXPECT_EQ(c.code, static_cast<std::uint32_t>(code.value())) << c.image;
  }

  // Most significant byte first, two lower-case digits a byte, zeros kept.
  const auto serial = get_signature(image_path(L"child_serial"), code);
  ASSERT_TRUE(serial.has_value()) << code.value();
  EXPECT_EQ(serial->serial_number, VORBEL_SIGNER_SERIAL_NUMBER);
  EXPECT_EQ(serial->subject, VORBEL_SIGNER_SERIAL_SUBJECT);
  EXPECT_EQ(serial->issuer, VORBEL_ROOT_SUBJECT);
}

}  // namespace
