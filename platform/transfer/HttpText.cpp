#include "platform/transfer/HttpText.h"

#include <cctype>

namespace httptext {

std::string Lower(std::string text) {
    for (char& c : text) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    return text;
}

std::string FoldSpaces(const std::string& value, bool printableOnly) {
    std::string out;
    bool pendingSpace = false;
    for (unsigned char c : value) {
        if (c == ' ' || c == '\t') {
            pendingSpace = !out.empty();
            continue;
        }
        if (pendingSpace) out.push_back(' ');
        pendingSpace = false;
        out.push_back(!printableOnly || (c >= 0x21 && c < 0x7f) ? static_cast<char>(c) : '_');
    }
    return out;
}

std::string PercentEncode(const std::string& text, bool (*keep)(unsigned char)) {
    static const char kDigits[] = "0123456789ABCDEF";
    std::string out;
    out.reserve(text.size());
    for (unsigned char c : text) {
        if (keep(c)) {
            out.push_back(static_cast<char>(c));
        } else {
            out.push_back('%');
            out.push_back(kDigits[c >> 4]);
            out.push_back(kDigits[c & 0x0f]);
        }
    }
    return out;
}

std::string Redact(std::string text, const std::vector<std::string>& secrets) {
    for (const auto& secret : secrets) {
        if (secret.size() < 4) continue;
        for (size_t at = text.find(secret); at != std::string::npos;
             at = text.find(secret, at + 3)) {
            text.replace(at, secret.size(), "***");
        }
    }
    return text;
}

}  // namespace httptext
