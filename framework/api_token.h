#pragma once

// The HTTP API's bearer token: changes (PUT, DELETE) need it always, and every request needs it
// when the API listens on an address other than a loopback one.
//
// The token lives in <configdir>q7_api_token, created at the first start with 0600 permissions
// and 32 random bytes written as 64 hexadecimal digits; an operator may replace its contents.
//
// Thread safety: pure functions, except LoadOrCreateApiToken, which the main loop calls once.

#include <string>
#include <string_view>

namespace fw {

// Reads the token from path, creating the file first when it does not exist. Returns kOk with
// the token (surrounding white space dropped), or kIoError with *error when the file cannot be
// read or created or holds no token.
int LoadOrCreateApiToken(const std::string& path, std::string* token, std::string* error);

// True for host texts that name the loopback interface: 127.0.0.0/8, ::1, "localhost".
bool IsLoopbackHost(std::string_view host);

// True when an Authorization header value is "Bearer <token>" for this token. Compares in time
// independent of where the texts differ.
bool BearerMatches(std::string_view header, std::string_view token);

}  // namespace fw
