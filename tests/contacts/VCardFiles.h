#pragma once

#include "contacts/vcard/VCardExport.h"
#include "contacts/vcard/VCardImport.h"

#include <sstream>
#include <string>

namespace rolvane::vcardtest {

inline VCardImportReport importText(CXRolvane& database, const std::string& text, const std::string& charset = {}) {
    VCardImport import(database);
    import.setCharset(charset);
    std::istringstream in(text);
    import.addStream(in, "text.vcf", text.size());
    return import.finish();
}

inline std::string exportAll(CXRolvane& database, VCardVersion version) {
    std::ostringstream out;
    VCardExport(database, out, version).exportAll();
    return out.str();
}

inline std::string card(const std::string& lines, const std::string& version = "3.0") {
    return "BEGIN:VCARD\r\nVERSION:" + version + "\r\n" + lines + "END:VCARD\r\n";
}

} // namespace rolvane::vcardtest
