// Host-name checks of the TLS layer: whether a name from a peer certificate stands for the host
// the caller expects to reach.
#ifndef S2S_NET_TLS_HOST_MATCH_H
#define S2S_NET_TLS_HOST_MATCH_H

#include <string>

typedef struct x509_st X509;

namespace S2S {
namespace tls {

// Compares ASCII letters without regard to case (other bytes exactly, whatever the locale).
// A certificate name "*.domain" stands for the domain itself and for any host exactly one label
// below it ("*.example.lan" covers "example.lan" and "nas.example.lan", not
// "a.nas.example.lan"). A lone "*", or an asterisk not followed by a dot and at least one more
// character, never matches.
bool HostNameMatches(const std::string& cert_name, const std::string& host);

// True when the first commonName of the subject, or else one of the DNS-type subject alternative
// names (in certificate order), matches `host`. Names with an embedded NUL never match: they
// are forged to pass a C-string comparison.
bool CertificateMatchesHost(X509* cert, const std::string& host);

}  // namespace tls
}  // namespace S2S

#endif  // S2S_NET_TLS_HOST_MATCH_H
