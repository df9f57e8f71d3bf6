// Fuzz target of the host's request reading (host/request_handler.h,
// host/wire_protocol.h): what the HTTP layer hands over (query, body,
// Content-Type, cookies, token header, header size) for each of the three
// endpoints, answered by a whole host without sockets (fuzz_host.h).
//
// Input: byte 0 the endpoint (modulo 3) and POST (bit 2); byte 1 whose
// session the request carries (modulo 6: none, the administrator's, the
// administrator's with a wrong token, the administrator's without token,
// the non-administrator's, cookie and token from the input); byte 2 the
// header size in 128-byte steps; then pieces separated by kPieceSeparator:
// query, body, Content-Type, cookies, token.
//
// Besides not crashing or leaking:
// - every answer has the wire protocol's shape (CheckHostAnswer);
// - without a valid session and token nothing but a login succeeds, and a
//   non-administrator never runs a method;
// - a method that throws is answered with code 100;
// - the pieces of the request reading keep their promises on the raw
//   texts: form decoding within its field bound and with named fields, a
//   cookie value found inside the cookie text, versions of digits only and
//   in range, parameter values read without an exception.
#include "fuzz_host.h"
#include "fuzz_support.h"
#include "syslog_capture.h"
#include "webapi.h"
#include "wire_protocol.h"

#include <cstddef>
#include <cstdint>
#include <string>

namespace {

using zark::fuzz::Require;
using namespace zark::host;

enum SessionChoice {
  kNoSession,
  kAdmin,
  kAdminWrongToken,
  kAdminNoToken,
  kViewer,
  kFromInput,
  kSessionChoices,
};

void CheckPieces(std::string_view query, std::string_view cookies) {
  FormFields fields;
  const FormResult result = DecodeForm(query, 16, fields);
  Require(fields.size() <= 16, "DecodeForm beyond its field bound");
  if (result == FormResult::Ok) {
    for (const FormField &field : fields) {
      Require(!field.name.empty(), "a decoded field without a name");
      try {
        (void)ParamValue(field.value);
      } catch (...) {
        zark::fuzz::Broken("ParamValue threw");
      }
      const std::optional<int> version = ParseVersion(field.value);
      if (version) {
        Require(*version >= 1 && !field.value.empty() &&
                    field.value.find_first_not_of("0123456789") ==
                        std::string::npos,
                "a version that is not digits in range: " + field.value);
      }
    }
  }
  const std::string_view id = FindCookie(cookies, kSessionCookie);
  Require(id.empty() ||
              (id.data() >= cookies.data() &&
               id.data() + id.size() <= cookies.data() + cookies.size()),
          "a cookie value outside the cookie text");
}

} // namespace

extern "C" int LLVMFuzzerInitialize(int *, char ***) {
  zark::fuzz::EnterHermeticOrDie();
  zark::fuzz::FuzzHost::Prepare();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  zark::test::ClearLogs();
  zark::fuzz::InputReader input(zark::fuzz::AsText(data, size));
  const uint8_t shape = input.Byte();
  const int session = input.Byte() % kSessionChoices;
  const std::size_t headerBytes = std::size_t{input.Byte()} * 128;
  const std::string_view query = input.Piece(zark::fuzz::kPieceSeparator);
  const std::string_view body = input.Piece(zark::fuzz::kPieceSeparator);
  const std::string_view contentType = input.Piece(zark::fuzz::kPieceSeparator);
  const std::string_view cookies = input.Piece(zark::fuzz::kPieceSeparator);
  const std::string_view token = input.Piece(zark::fuzz::kPieceSeparator);

  CheckPieces(query, cookies);

  zark::fuzz::FuzzHost host;
  WebRequest request;
  request.endpoint = static_cast<Endpoint>(shape % 3);
  request.isPost = (shape & 4) != 0;
  request.query = query;
  request.body = body;
  request.contentType = contentType;
  request.clientAddress = "192.168.77.2";
  request.headerBytes = headerBytes;
  std::string heldCookie;
  std::string heldToken;
  switch (session) {
  case kNoSession:
    break;
  case kAdmin:
  case kAdminWrongToken:
  case kAdminNoToken:
    heldCookie = "lang=en; id=" + host.Sessions().admin.id;
    heldToken = session == kAdminWrongToken ? host.Sessions().viewer.token
                                            : host.Sessions().admin.token;
    request.cookies = heldCookie;
    if (session != kAdminNoToken) {
      request.token = heldToken;
    }
    break;
  case kViewer:
    heldCookie = "id=" + host.Sessions().viewer.id;
    request.cookies = heldCookie;
    request.token = host.Sessions().viewer.token;
    break;
  default:
    request.cookies = cookies;
    request.token = token;
    break;
  }

  const WebAnswer answer = host.Handler().Handle(request);
  zark::fuzz::CheckHostAnswer(answer.httpStatus, answer.body);
  const bool success = answer.body["success"].asBool();
  if (request.endpoint == Endpoint::Entry) {
    Require(!success || session == kAdmin,
            "a method ran without an administrator's session and token");
  }
  if (request.endpoint == Endpoint::Query) {
    Require(!success || session == kAdmin || session == kViewer,
            "query answered without a valid session and token");
  }
  // The host logs a method that threw; its answer must be code 100.
  for (const zark::test::LogLine &line : zark::test::CapturedLogs()) {
    if (line.message.find(" threw") != std::string::npos) {
      Require(!success && answer.body["error"]["code"].asInt() ==
                              ZARK::WEBAPI_ERR_UNKNOWN,
              "a method threw and the answer is not code 100");
    }
  }
  return 0;
}
