// The token exchange on the sandbox socket (SOCK_SEQPACKET, one exchange per connection):
//   client -> daemon: one message, the token's text (a trailing zero byte is allowed), with the
//                     writer's credentials (SCM_CREDENTIALS); for a token of a directory, a zero
//                     byte and a relative path may follow: the entry beneath it to open (under a
//                     Landlock sandbox, a directory's descriptor lists it but opens nothing in it);
//   daemon -> client: "file" or "directory" with the opened descriptor (SCM_RIGHTS), or
//                     "refused: <reason>" without one; then the daemon closes the connection.
#pragma once

#include <cstddef>

namespace typhora::sandboxexchange {

inline constexpr const char* kSocketName = "com.zorvane.typhorad.sandbox";
// A token is a short header and a path: PATH_MAX and room to spare.
inline constexpr std::size_t kMaxTokenSize = 4096 + 256;
inline constexpr const char* kFile = "file";
inline constexpr const char* kDirectory = "directory";
inline constexpr const char* kRefused = "refused: ";

}  // namespace typhora::sandboxexchange
