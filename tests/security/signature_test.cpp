// Code-signature reading on real images signed by the build.
#include <gtest/gtest.h>

#include "platform/win_error.h"
#include "security/images.h"
#include "security/signature.h"
#include "support/log_capture.h"

namespace {

using security_test::image_path;
using test_support::find_lines;

class signature_test : public ::testing::Test {
 protected:
  void SetUp() override { test_support::clear_log(); }
};

TEST_F(signature_test, unsigned_image_is_not_trusted_and_has_no_signature) {
  const std::wstring path = image_path(L"child_unsigned");
  std::error_code code = winapi::make_win_error(1);
  EXPECT_FALSE(is_trusted(path, code));
  EXPECT_FALSE(code) << code.value();

  const auto found = get_signature(path, code);
  EXPECT_FALSE(found.has_value());
  EXPECT_EQ(static_cast<std::uint32_t>(code.value()), 0x80092009u);  // CryptQueryObject: not found
  EXPECT_EQ(&code.category(), &winapi::win_error_category());
  const auto lines = find_lines(L"get_signature", L"get_signature err=0x80092009 ");
  ASSERT_EQ(lines.size(), 1u) << test_support::dump_log();
  EXPECT_EQ(lines[0].level, 8u);
  const std::string message = code.message();
  EXPECT_EQ(lines[0].text, L"get_signature err=0x80092009 " + std::wstring(message.begin(), message.end()));
  EXPECT_EQ(find_lines(L"get_signature", L"-> get_signature()").size(), 1u);
}

TEST_F(signature_test, image_signed_by_our_signer_reads_back_the_certificate) {
  const std::wstring path = image_path(L"child_a");
  std::error_code code;
  EXPECT_TRUE(is_trusted(path, code));
  EXPECT_FALSE(code);

  const auto found = get_signature(path, code);
  ASSERT_TRUE(found.has_value()) << code.value();
  EXPECT_EQ(found->serial_number, VORBEL_SIGNER_A_SERIAL);
  // The test program itself is signed by the same signer.
  const auto current = get_current_signature();
  ASSERT_TRUE(current.has_value()) << test_support::dump_log();
  EXPECT_FALSE(current->subject.empty());
  EXPECT_EQ(found->subject, current->subject);
  EXPECT_EQ(found->issuer, current->issuer);
  EXPECT_EQ(found->serial_number, current->serial_number);
}

TEST_F(signature_test, serial_issuer_and_subject_are_exact) {
  std::error_code code;
  const auto found = get_signature(image_path(L"child_serial"), code);
  ASSERT_TRUE(found.has_value()) << code.value();
  EXPECT_FALSE(code);
  // Most significant byte first, two lower-case digits per byte, zero bytes
  // and bytes below 0x10 kept.
  EXPECT_EQ(found->serial_number, VORBEL_SIGNER_SERIAL_NUMBER);
  EXPECT_EQ(found->subject, VORBEL_SIGNER_SERIAL_SUBJECT);
  EXPECT_EQ(found->issuer, VORBEL_ROOT_SUBJECT);
}

TEST_F(signature_test, tampered_image_fails_verification_with_the_system_code) {
  const std::wstring path = image_path(L"child_tampered");
  std::error_code code;
  EXPECT_FALSE(is_trusted(path, code));
  EXPECT_EQ(static_cast<std::uint32_t>(code.value()), 0x80096010u);  // TRUST_E_BAD_DIGEST
  // The signer is still readable: verification, not reading, judges it.
  const auto found = get_signature(path, code);
  ASSERT_TRUE(found.has_value());
  EXPECT_EQ(found->serial_number, VORBEL_SIGNER_A_SERIAL);
}

TEST_F(signature_test, certificate_without_subject_name_gives_not_found) {
  std::error_code code;
  const auto found = get_signature(image_path(L"child_noname"), code);
  EXPECT_FALSE(found.has_value());
  EXPECT_EQ(code.value(), 1168);
  EXPECT_EQ(find_lines(L"get_signature", L"get_signature err=0x490 ").size(), 1u) << test_support::dump_log();
}

TEST_F(signature_test, missing_file_is_an_error_not_a_verdict) {
  const std::wstring path = image_path(L"no_such_image");
  std::error_code code;
  EXPECT_FALSE(is_trusted(path, code));
  EXPECT_TRUE(code);
  signature record = read_signature(path, code);
  EXPECT_TRUE(code);
  EXPECT_TRUE(record.serial_number.empty() && record.issuer.empty() && record.subject.empty());
}

}  // namespace
