#include "platform/logger/SecretMask.h"

#include <strings.h>

#include <algorithm>
#include <cstring>
#include <vector>

namespace {

constexpr const char* kSecretNames[] = {"token", "password", "passphrase", "x-amz-signature",
                                        "x-amz-security-token"};

bool endsValue(char c) {
    return c == '\0' || c == '&' || c == ';' || c == '#' || c == '"' || c == '\'' || c == ' ' ||
           c == '\t' || c == '\n';
}

// A half-open range [begin, end) of the text to be written as "***".
struct Span {
    size_t begin;
    size_t end;
};

// User information of every URL: from after "://" to the '@' that precedes the host's end.
void findUserInfo(const char* text, std::vector<Span>* spans) {
    for (const char* scheme = std::strstr(text, "://"); scheme != nullptr;
         scheme = std::strstr(scheme + 3, "://")) {
        const char* start = scheme + 3;
        const char* p = start;
        const char* at = nullptr;
        while (*p != '\0' && !std::strchr("/?# \t\n\"'", *p)) {
            if (*p == '@') at = p;
            ++p;
        }
        if (at != nullptr && at > start)
            spans->push_back({static_cast<size_t>(start - text), static_cast<size_t>(at - text)});
    }
}

// Values of the secret query parameters: a name preceded by '?', '&' or ';' and followed by '='.
void findParameters(const char* text, std::vector<Span>* spans) {
    for (const char* eq = std::strchr(text, '='); eq != nullptr; eq = std::strchr(eq + 1, '=')) {
        for (const char* name : kSecretNames) {
            const size_t length = std::strlen(name);
            const char* begin = eq - length;
            if (eq - text < static_cast<std::ptrdiff_t>(length + 1) ||
                strncasecmp(begin, name, length) != 0 || !std::strchr("?&;", begin[-1]))
                continue;
            const char* end = eq + 1;
            while (!endsValue(*end)) ++end;
            if (end > eq + 1)
                spans->push_back(
                    {static_cast<size_t>(eq + 1 - text), static_cast<size_t>(end - text)});
            break;
        }
    }
}

}  // namespace

bool MaskSecrets(const char* text, std::string* masked) {
    std::vector<Span> spans;
    findUserInfo(text, &spans);
    findParameters(text, &spans);
    if (spans.empty()) return false;
    // A parameter inside user information (or the reverse) is covered by the earlier span.
    std::sort(spans.begin(), spans.end(),
              [](const Span& a, const Span& b) { return a.begin < b.begin; });
    masked->clear();
    size_t at = 0;
    for (const Span& span : spans) {
        if (span.begin < at) continue;
        masked->append(text + at, span.begin - at);
        masked->append("***");
        at = span.end;
    }
    masked->append(text + at);
    return true;
}

std::string MaskedSecrets(const std::string& text) {
    std::string masked;
    return MaskSecrets(text.c_str(), &masked) ? masked : text;
}
