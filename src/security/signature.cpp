#include "security/signature.h"

#include <windows.h>
#include <softpub.h>
#include <wincrypt.h>
#include <wintrust.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <memory>
#include <new>

#include "logging/logger.h"
#include "platform/handles.h"
#include "platform/win_api.h"
#include "platform/win_error.h"

namespace {

constexpr DWORD trust_e_subject_not_trusted = 0x800B0004;
constexpr DWORD trust_e_nosignature = 0x800B0100;
constexpr DWORD crypt_e_not_found = 0x80092004;

// The trust data as current systems define it (88 bytes: it ends with the
// signature-settings pointer, null here). Older headers stop 8 bytes short,
// so the structure is laid into a zeroed block of the full size.
constexpr DWORD wintrust_data_size = 88;
union wintrust_data_block {
  WINTRUST_DATA data;
  unsigned char bytes[wintrust_data_size];
};
static_assert(sizeof(WINTRUST_DATA) <= wintrust_data_size, "unexpected WINTRUST_DATA layout");

struct cert_store_traits {
  using pointer = HCERTSTORE;
  static void close(HCERTSTORE store) noexcept { ::CertCloseStore(store, /* flags */ 0); }
};
struct crypt_msg_traits {
  using pointer = HCRYPTMSG;
  static void close(HCRYPTMSG message) noexcept { ::CryptMsgClose(message); }
};
struct cert_context_traits {
  using pointer = PCCERT_CONTEXT;
  static void close(PCCERT_CONTEXT context) noexcept { ::CertFreeCertificateContext(context); }
};
using unique_cert_store = winapi::unique_any<cert_store_traits>;
using unique_crypt_msg = winapi::unique_any<crypt_msg_traits>;
using unique_cert_context = winapi::unique_any<cert_context_traits>;

std::error_code last_error() { return winapi::make_win_error(::GetLastError()); }

// One of the certificate's simple display names (flags 0: subject, 1:
// issuer). A certificate without such a name gives 1168.
std::wstring name_string(PCCERT_CONTEXT certificate, DWORD flags, std::error_code& code) {
  const DWORD length = ::CertGetNameStringW(certificate, CERT_NAME_SIMPLE_DISPLAY_TYPE, flags,
                                            /* type_para */ nullptr, /* name */ nullptr, /* size */ 0);
  if (length == 0) {
    code = last_error();
    return {};
  }
  std::wstring name(length, L'\0');
  const DWORD written = ::CertGetNameStringW(certificate, CERT_NAME_SIMPLE_DISPLAY_TYPE, flags,
                                             /* type_para */ nullptr, name.data(), length);
  if (written == 0) {
    code = last_error();
    return {};
  }
  if (written == 1) {
    code = winapi::make_win_error(ERROR_NOT_FOUND);
    return {};
  }
  name.resize(std::min<DWORD>(written, length) - 1);
  return name;
}

// The serial number is stored least significant byte first.
std::wstring serial_text(const CRYPT_INTEGER_BLOB& serial) {
  static const wchar_t digits[] = L"0123456789abcdef";
  std::wstring text;
  text.reserve(static_cast<std::size_t>(serial.cbData) * 2);
  for (DWORD i = serial.cbData; i > 0; --i) {
    const BYTE b = serial.pbData[i - 1];
    text.push_back(digits[b >> 4]);
    text.push_back(digits[b & 0x0F]);
  }
  return text;
}

// The settings every verification uses (see is_trusted), for `file_info`.
void fill_trust_data(WINTRUST_DATA& data, WINTRUST_FILE_INFO* file_info) {
  data.cbStruct = wintrust_data_size;
  data.pPolicyCallbackData = nullptr;
  data.pSIPClientData = nullptr;
  data.dwUIChoice = WTD_UI_NONE;
  data.fdwRevocationChecks = WTD_REVOKE_NONE;
  data.dwUnionChoice = WTD_CHOICE_FILE;
  data.pFile = file_info;
  data.dwStateAction = 0;  // ignore: no state to close afterwards
  data.hWVTStateData = nullptr;
  data.pwszURLReference = nullptr;
  // 0x10 no revocation check, 0x1000 URL retrieval from the cache only: a
  // verification never waits on the network.
  data.dwProvFlags = 0x1010;
  data.dwUIContext = 0;
}

// The signer record of a certificate; empty and the code on failure.
signature signer_of(PCCERT_CONTEXT certificate, std::error_code& code) {
  code = {};
  if (certificate == nullptr || certificate->pCertInfo == nullptr) {
    code = winapi::make_win_error(ERROR_INVALID_DATA);
    return {};
  }
  signature result;
  result.serial_number = serial_text(certificate->pCertInfo->SerialNumber);
  result.issuer = name_string(certificate, CERT_NAME_ISSUER_FLAG, code);
  if (code) return {};
  result.subject = name_string(certificate, 0, code);
  if (code) return {};
  return result;
}

}  // namespace

bool is_trusted(const std::wstring& path, std::error_code& code) {
  WINTRUST_FILE_INFO file_info{};
  file_info.cbStruct = sizeof(WINTRUST_FILE_INFO);
  file_info.pcwszFilePath = path.c_str();
  file_info.hFile = nullptr;
  file_info.pgKnownSubject = nullptr;

  wintrust_data_block block;
  std::memset(&block, 0, sizeof(block));
  WINTRUST_DATA& data = block.data;
  fill_trust_data(data, &file_info);

  GUID action = WINTRUST_ACTION_GENERIC_VERIFY_V2;
  const LONG result = ::WinVerifyTrust(/* window */ nullptr, &action, &data);
  switch (static_cast<DWORD>(result)) {
    case 0:
      code = {};
      return true;
    case trust_e_subject_not_trusted:
    case trust_e_nosignature:
      code = {};
      return false;
    default:
      code = winapi::make_win_error(static_cast<std::uint32_t>(result));
      return false;
  }
}

signature read_signature(const std::wstring& path, std::error_code& code) {
  code = {};
  DWORD encoding = 0;
  DWORD content_type = 0;
  DWORD format_type = 0;
  HCERTSTORE raw_store = nullptr;
  HCRYPTMSG raw_message = nullptr;
  const BOOL queried = ::CryptQueryObject(CERT_QUERY_OBJECT_FILE, path.c_str(),
                                          /* expected_content */ CERT_QUERY_CONTENT_FLAG_PKCS7_SIGNED_EMBED,
                                          /* expected_format */ CERT_QUERY_FORMAT_FLAG_BINARY,
                                          /* flags */ 0, &encoding, &content_type, &format_type, &raw_store,
                                          &raw_message, /* context */ nullptr);
  if (!queried) {
    code = last_error();
    return {};
  }
  // Released in reverse: certificate, signer information, message, store.
  unique_cert_store store(raw_store);
  unique_crypt_msg message(raw_message);

  DWORD size = 0;
  if (!::CryptMsgGetParam(message.get(), CMSG_SIGNER_INFO_PARAM, /* index */ 0, nullptr, &size)) {
    code = last_error();
    return {};
  }
  std::unique_ptr<BYTE[]> signer_buffer(new (std::nothrow) BYTE[size == 0 ? 1 : size]);
  if (!signer_buffer) {
    code = winapi::make_win_error(ERROR_NOT_ENOUGH_MEMORY);
    return {};
  }
  DWORD written = size;
  if (!::CryptMsgGetParam(message.get(), CMSG_SIGNER_INFO_PARAM, /* index */ 0, signer_buffer.get(), &written)) {
    code = last_error();
    return {};
  }
  size = std::min(size, written);
  if (size < sizeof(CMSG_SIGNER_INFO)) {
    code = winapi::make_win_error(ERROR_INVALID_DATA);
    return {};
  }
  const auto* signer = reinterpret_cast<const CMSG_SIGNER_INFO*>(signer_buffer.get());

  CERT_INFO wanted{};
  wanted.Issuer = signer->Issuer;
  wanted.SerialNumber = signer->SerialNumber;
  unique_cert_context certificate(::CertFindCertificateInStore(
      store.get(), /* encoding */ X509_ASN_ENCODING | PKCS_7_ASN_ENCODING, /* flags */ 0,
      /* find_type */ CERT_FIND_SUBJECT_CERT, &wanted, /* previous */ nullptr));
  if (!certificate) {
    const DWORD error = ::GetLastError();
    // A signer whose certificate did not travel with the file: nothing to
    // name, but nothing failed either.
    if (error != crypt_e_not_found) code = winapi::make_win_error(error);
    return {};
  }
  if (certificate.get()->pCertInfo == nullptr) {
    code = winapi::make_win_error(ERROR_INVALID_DATA);
    return {};
  }

  signature result;
  result.serial_number = serial_text(certificate.get()->pCertInfo->SerialNumber);
  result.issuer = name_string(certificate.get(), CERT_NAME_ISSUER_FLAG, code);
  if (code) return {};
  result.subject = name_string(certificate.get(), 0, code);
  if (code) return {};
  return result;
}

image_verdict verify_image(HANDLE file, const std::wstring& path) {
  WINTRUST_FILE_INFO file_info{};
  file_info.cbStruct = sizeof(WINTRUST_FILE_INFO);
  file_info.pcwszFilePath = path.c_str();
  file_info.hFile = file;  // the file as opened, not whatever is at the path now
  file_info.pgKnownSubject = nullptr;

  wintrust_data_block block;
  std::memset(&block, 0, sizeof(block));
  WINTRUST_DATA& data = block.data;
  fill_trust_data(data, &file_info);
  // Keep the provider's state: the signer is read from it, then it is closed.
  data.dwStateAction = WTD_STATEACTION_VERIFY;

  image_verdict verdict;
  GUID action = WINTRUST_ACTION_GENERIC_VERIFY_V2;
  // The provider's state is closed however this function leaves.
  struct state_closer {
    WINTRUST_DATA& data;
    GUID& action;
    ~state_closer() {
      if (data.hWVTStateData == nullptr) return;
      data.dwStateAction = WTD_STATEACTION_CLOSE;
      ::WinVerifyTrust(/* window */ nullptr, &action, &data);
    }
  } closer{data, action};
  const LONG result = ::WinVerifyTrust(/* window */ nullptr, &action, &data);
  verdict.result = static_cast<std::uint32_t>(result);
  switch (static_cast<DWORD>(result)) {
    case 0:
      verdict.trusted = true;
      break;
    case trust_e_subject_not_trusted:
    case trust_e_nosignature:
      break;
    default:
      verdict.code = winapi::make_win_error(static_cast<std::uint32_t>(result));
      break;
  }
  if (verdict.trusted) {
    CRYPT_PROVIDER_DATA* provider = ::WTHelperProvDataFromStateData(data.hWVTStateData);
    CRYPT_PROVIDER_SGNR* signer =
        provider != nullptr ? ::WTHelperGetProvSignerFromChain(provider, /* signer */ 0, /* counter_signer */ FALSE,
                                                               /* counter_index */ 0)
                            : nullptr;
    if (signer == nullptr || signer->csCertChain == 0 || signer->pasCertChain == nullptr) {
      verdict.signer_code = winapi::make_win_error(ERROR_NOT_FOUND);
    } else {
      signature record = signer_of(signer->pasCertChain[0].pCert, verdict.signer_code);
      if (!verdict.signer_code) verdict.signer = std::move(record);
    }
    if (verdict.signer_code) {
      logging::logger_stream(logging::level_warning, L"get_signature")
          << L"get_signature err=0x" << verdict.signer_code.value() << L" " << verdict.signer_code.message();
    }
  }
  return verdict;
}

std::optional<signature> get_signature(const std::wstring& path, std::error_code& code) {
  logging::trace_scope trace(L"get_signature");
  signature result = read_signature(path, code);
  if (code) {
    logging::logger_stream(logging::level_warning, L"get_signature")
        << L"get_signature err=0x" << code.value() << L" " << code.message();
    return std::nullopt;
  }
  return result;
}

std::optional<signature> get_current_signature() {
  std::error_code code;
  const std::wstring path = winapi::this_process::get_filename(code);
  if (code) {
    logging::logger_stream(logging::level_error, L"get_current_signature")
        << L"this_process::get_filename err=0x" << code.value() << L" " << code.message();
    return std::nullopt;
  }
  signature result = read_signature(path, code);
  if (code) {
    logging::logger_stream(logging::level_warning, L"get_current_signature")
        << L"get_signature err=0x" << code.value() << L" " << code.message();
    return std::nullopt;
  }
  return result;
}
