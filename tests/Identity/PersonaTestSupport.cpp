#include "Identity/PersonaTestSupport.h"

#include <unistd.h>

#include <cstdio>
#include <stdexcept>

#include "Platform/Log.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"

namespace vsl::test {

PersonaAttributes attributesFor(const PersonaRow& row) {
    PersonaAttributes a;
    a.isPersonal = row.kind == Kind::Personal;
    a.isEnterprise = row.kind == Kind::Enterprise;
    a.isUniversal = row.kind == Kind::Universal;
    a.isSystem = row.kind == Kind::System;
    a.uniqueString = row.uniqueString;
    a.kernelPersonaID = row.kernelPersonaID;
    a.uid = row.uid;
    if (row.uid) a.gid = *row.uid;
    a.bundleIdentifiers = row.bundles;
    if (row.home) a.layoutPath = rootedPath(*row.home);
    return a;
}

PersonaAttributesList attributesFor(const std::vector<PersonaRow>& rows) {
    PersonaAttributesList list;
    for (const auto& s : rows) list.push_back(attributesFor(s));
    return list;
}

Value entryFor(const PersonaRow& row) {
    uint64_t type = row.kind == Kind::Personal ? 0 : row.kind == Kind::Enterprise ? 1 : 2;
    Dictionary d{{"PersonaType", Value::uint64(type)}, {"KernelPersonaID", Value::uint64(row.kernelPersonaID)}};
    if (row.kind == Kind::Universal) d["Universal"] = Value::boolean(true);
    if (row.kind == Kind::System) d["System"] = Value::boolean(true);
    if (row.uniqueString) d["PersonaUniqueString"] = Value::string(*row.uniqueString);
    if (row.uid) {
        d["UID"] = Value::uint64(*row.uid);
        d["GID"] = Value::uint64(*row.uid);
    }
    if (row.home) d["HomeDirectory"] = Value::string(*row.home);
    Array bundles;
    for (const auto& b : row.bundles) bundles.push_back(Value::string(b));
    d["BundleIdentifiers"] = Value::array(std::move(bundles));
    return Value::dictionary(std::move(d));
}

namespace {
std::string encoded(const std::vector<PersonaRow>& rows) {
    Array entries;
    for (const auto& s : rows) entries.push_back(entryFor(s));
    return encodeBinaryPropertyList(Value::array(std::move(entries)), nullptr).value();
}
}  // namespace

void writePersonas(const TempRoot& root, const std::vector<PersonaRow>& rows) {
    root.writeFile("etc/vesseld/personas.plist", encoded(rows));
}

void replacePersonasAtomically(const TempRoot& root, const std::vector<PersonaRow>& rows) {
    root.writeFile("etc/vesseld/.personas.plist.new", encoded(rows));
    std::rename(root.at("etc/vesseld/.personas.plist.new").c_str(), root.at("etc/vesseld/personas.plist").c_str());
}

void makePersonasUnreadable(const TempRoot& root) {
    std::string link = root.at("etc/vesseld/.personas.plist.link");
    if (::symlink(".", link.c_str()) != 0 || std::rename(link.c_str(), root.at("etc/vesseld/personas.plist").c_str()))
        throw std::runtime_error("cannot replace personas.plist");
}

std::vector<PersonaRow> standardPersonas() {
    return {
        {Kind::Personal, 1000, "P-1", {}, 501, std::nullopt},
        {Kind::Enterprise, 1001, "E-1", {"com.example.mail"}, 502, "/private/var/PersonaVolumes/E-1"},
        {Kind::Enterprise, 1002, "E-2", {"com.example.mail", "com.example.notes"}, std::nullopt,
         "/private/var/PersonaVolumes/E-2"},
        {Kind::Universal, 900, "U-1", {"com.example.phone"}, std::nullopt, std::nullopt},
        {Kind::System, 901, std::nullopt, {"com.example.settings"}, std::nullopt, std::nullopt},
        {Kind::Enterprise, 1003, std::nullopt, {"com.example.lost"}, std::nullopt, std::nullopt},
    };
}

LogCapture::LogCapture(std::string directory) : directory_(std::move(directory)) {
    LogFileOptions options;
    options.directory = directory_;
    openLogFile(options);
}

LogCapture::~LogCapture() { closeLogFile(); }

std::string LogCapture::contents() const { return readFile(directory_ + "/vesseld.log"); }

bool waitUntil(std::mutex& mutex, std::condition_variable& changed, const std::function<bool()>& done) {
    std::unique_lock lock(mutex);
    return changed.wait_for(lock, std::chrono::seconds(30), done);
}

}  // namespace vsl::test
