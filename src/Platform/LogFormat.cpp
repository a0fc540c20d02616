// The log formatter: %@ and the printf conversions over already-converted arguments.
// Each conversion is re-issued to snprintf with a fixed 64-bit type, so flags, width
// and precision behave exactly as printf's.
#include "Platform/Log.h"

#include <algorithm>
#include <cinttypes>
#include <cstdio>
#include <cstring>

namespace vsl {
namespace {

// Widths and precisions beyond this are clamped: a format cannot make us allocate much.
constexpr int kMaxField = 4096;

struct Spec {
    std::string flags;
    int width = -1;
    int precision = -1;
    bool leftAlign() const { return flags.find('-') != std::string::npos; }
};

template <class T>
void appendPrintf(std::string& out, const Spec& spec, const char* length, char conversion, T value) {
    std::string fmt = "%" + spec.flags;
    if (spec.width >= 0) fmt += std::to_string(spec.width);
    if (spec.precision >= 0) fmt += "." + std::to_string(spec.precision);
    fmt += length;
    fmt += conversion;
    char buffer[128];
    int n = std::snprintf(buffer, sizeof buffer, fmt.c_str(), value);
    if (n < 0) return;
    if (static_cast<size_t>(n) < sizeof buffer) {
        out.append(buffer, static_cast<size_t>(n));
        return;
    }
    std::string big(static_cast<size_t>(n) + 1, '\0');
    std::snprintf(big.data(), big.size(), fmt.c_str(), value);
    out.append(big.data(), static_cast<size_t>(n));
}

// %s-style: precision cuts, width pads with spaces.
void appendText(std::string& out, const Spec& spec, std::string_view text) {
    if (spec.precision >= 0 && text.size() > static_cast<size_t>(spec.precision)) text = text.substr(0, spec.precision);
    size_t pad = spec.width > 0 && static_cast<size_t>(spec.width) > text.size() ? spec.width - text.size() : 0;
    if (!spec.leftAlign()) out.append(pad, ' ');
    out.append(text);
    if (spec.leftAlign()) out.append(pad, ' ');
}

std::string pointerText(const void* p) {
    char buffer[32];
    std::snprintf(buffer, sizeof buffer, "0x%" PRIxPTR, reinterpret_cast<uintptr_t>(p));
    return buffer;
}

// What %@ (and %s of a non-string) shows for each kind of argument.
std::string naturalText(const LogArg& a) {
    switch (a.kind) {
    case LogArg::Kind::Signed: return std::to_string(a.i);
    case LogArg::Kind::Unsigned: return std::to_string(a.u);
    case LogArg::Kind::Double: {
        char buffer[64];
        std::snprintf(buffer, sizeof buffer, "%g", a.d);
        return buffer;
    }
    case LogArg::Kind::Pointer: return pointerText(a.p);
    case LogArg::Kind::String:
    case LogArg::Kind::Object: return a.s;
    }
    return a.s;
}

int64_t asSigned(const LogArg& a) {
    switch (a.kind) {
    case LogArg::Kind::Signed: return a.i;
    case LogArg::Kind::Unsigned: return static_cast<int64_t>(a.u);
    case LogArg::Kind::Double:  // out-of-range casts are undefined; printf would not see this value anyway
        if (!(a.d > -9.2e18 && a.d < 9.2e18)) return a.d > 0 ? INT64_MAX : INT64_MIN;
        return static_cast<int64_t>(a.d);
    default: return static_cast<int64_t>(reinterpret_cast<intptr_t>(a.p));
    }
}

uint64_t asUnsigned(const LogArg& a) { return static_cast<uint64_t>(asSigned(a)); }

double asDouble(const LogArg& a) {
    switch (a.kind) {
    case LogArg::Kind::Double: return a.d;
    case LogArg::Kind::Unsigned: return static_cast<double>(a.u);
    default: return static_cast<double>(asSigned(a));
    }
}

bool isNumeric(const LogArg& a) {
    return a.kind == LogArg::Kind::Signed || a.kind == LogArg::Kind::Unsigned || a.kind == LogArg::Kind::Double;
}

void appendConversion(std::string& out, const Spec& spec, char c, const LogArg& a) {
    switch (c) {
    case 'd':
    case 'i':
        if (!isNumeric(a) && a.kind != LogArg::Kind::Pointer) return appendText(out, spec, naturalText(a));
        return appendPrintf(out, spec, "ll", c, static_cast<long long>(asSigned(a)));
    case 'u':
    case 'x':
    case 'X':
    case 'o':
        if (!isNumeric(a) && a.kind != LogArg::Kind::Pointer) return appendText(out, spec, naturalText(a));
        return appendPrintf(out, spec, "ll", c, static_cast<unsigned long long>(asUnsigned(a)));
    case 'c':
        if (!isNumeric(a)) return appendText(out, spec, naturalText(a));
        return appendPrintf(out, spec, "", c, static_cast<int>(static_cast<unsigned char>(asUnsigned(a))));
    case 'f':
    case 'F':
    case 'e':
    case 'E':
    case 'g':
    case 'G':
    case 'a':
    case 'A':
        if (!isNumeric(a)) return appendText(out, spec, naturalText(a));
        return appendPrintf(out, spec, "", c, asDouble(a));
    case 'p': {
        const void* p = a.kind == LogArg::Kind::Signed || a.kind == LogArg::Kind::Unsigned
                            ? reinterpret_cast<const void*>(static_cast<uintptr_t>(asUnsigned(a)))
                            : a.p;
        Spec plain = spec;
        plain.precision = -1;
        return appendText(out, plain, pointerText(p));
    }
    default:  // 's', '@'
        return appendText(out, spec, naturalText(a));
    }
}

bool isConversion(char c) { return std::strchr("diuxXocfFeEgGaAsp@", c) != nullptr; }

// Reads a decimal field, saturating at kMaxField.
int readNumber(std::string_view f, size_t& at) {
    int n = 0;
    while (at < f.size() && f[at] >= '0' && f[at] <= '9') {
        n = std::min(kMaxField, n * 10 + (f[at] - '0'));
        at++;
    }
    return n;
}

}  // namespace

std::string formatLogMessage(std::string_view format, const std::vector<LogArg>& args) {
    std::string out;
    out.reserve(format.size() + 16 * args.size());
    size_t next = 0;
    auto takeArg = [&]() -> const LogArg* { return next < args.size() ? &args[next++] : nullptr; };

    size_t at = 0;
    while (at < format.size()) {
        size_t percent = format.find('%', at);
        if (percent == std::string_view::npos) {
            out.append(format.substr(at));
            break;
        }
        out.append(format.substr(at, percent - at));
        size_t i = percent + 1;
        if (i < format.size() && format[i] == '%') {
            out += '%';
            at = i + 1;
            continue;
        }
        // Privacy and attribute annotations ({public}, {private, ...}) change nothing here.
        if (i < format.size() && format[i] == '{') {
            size_t close = format.find('}', i);
            if (close == std::string_view::npos) {
                out.append(format.substr(percent));
                break;
            }
            i = close + 1;
        }
        Spec spec;
        while (i < format.size() && std::strchr("-+ #0'", format[i]) != nullptr) spec.flags += format[i++];
        if (i < format.size() && format[i] == '*') {
            i++;
            const LogArg* w = takeArg();
            if (w && isNumeric(*w)) {
                int64_t v = asSigned(*w);
                if (v < 0) spec.flags += '-';
                spec.width = static_cast<int>(std::min<int64_t>(kMaxField, v < 0 ? -v : v));
            }
        } else if (i < format.size() && format[i] >= '0' && format[i] <= '9') {
            spec.width = readNumber(format, i);
        }
        if (i < format.size() && format[i] == '.') {
            i++;
            if (i < format.size() && format[i] == '*') {
                i++;
                const LogArg* p = takeArg();
                int64_t v = p && isNumeric(*p) ? asSigned(*p) : -1;
                spec.precision = v < 0 ? -1 : static_cast<int>(std::min<int64_t>(kMaxField, v));
            } else {
                spec.precision = readNumber(format, i);
            }
        }
        while (i < format.size() && std::strchr("hlzjtqL", format[i]) != nullptr) i++;
        if (i >= format.size()) {
            out.append(format.substr(percent));
            break;
        }
        char c = format[i];
        at = i + 1;
        if (!isConversion(c)) {
            out.append(format.substr(percent, at - percent));
            continue;
        }
        const LogArg* arg = takeArg();
        if (!arg) {
            appendText(out, spec, "(null)");
            continue;
        }
        appendConversion(out, spec, c, *arg);
    }
    return out;
}

}  // namespace vsl
