#include "Platform/LogFields.h"

#include <cstring>

namespace vsl {

namespace {
thread_local LogFieldScope* tInnermost = nullptr;
}  // namespace

LogFieldScope::LogFieldScope(const char* name, std::string_view value)
    : outer_(tInnermost), name_(name), value_(value) {
    tInnermost = this;
}

LogFieldScope::~LogFieldScope() { tInnermost = outer_; }

void forEachLogField(const std::function<void(const char*, std::string_view)>& visit) {
    for (const LogFieldScope* scope = tInnermost; scope; scope = scope->outer_) {
        if (scope->value_.empty()) continue;
        bool hidden = false;
        for (const LogFieldScope* inner = tInnermost; inner != scope && !hidden; inner = inner->outer_)
            hidden = !inner->value_.empty() && std::strcmp(inner->name_, scope->name_) == 0;
        if (!hidden) visit(scope->name_, scope->value_);
    }
}

}  // namespace vsl
