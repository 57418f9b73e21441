#include "contacts/vcard/ImportSource.h"

#include "contacts/vcard/TextCharset.h"
#include "contacts/vcard/VCardScanner.h"
#include "foundation/CXException.h"

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <sstream>
#include <stdlib.h>
#include <unistd.h>

namespace rolvane {

namespace {

constexpr size_t kStartBytes = 8 << 10;
constexpr size_t kMostUTF16 = 256 << 20;

[[noreturn]] void unreadable(const std::string& name, const std::string& why) {
    throw CXException(kCXVCardException, name + " cannot be read: " + why);
}

std::unique_ptr<std::fstream> temporaryFile(const std::string& name) {
    std::error_code error;
    std::string path = (std::filesystem::temp_directory_path(error) / "rolvane-import-XXXXXX").string();
    const int descriptor = ::mkstemp(path.data());
    if (descriptor < 0) unreadable(name, std::string("no temporary file can be made: ") + std::strerror(errno));
    auto file = std::make_unique<std::fstream>(path, std::ios::in | std::ios::out | std::ios::binary);
    ::close(descriptor);
    ::unlink(path.c_str());
    return file;
}

} // namespace

ImportSource ImportSource::ofFile(const std::string& path) {
    std::error_code error;
    if (std::filesystem::is_directory(path, error))
        throw CXException(kCXVCardException, path + " is a directory, not a file with contacts");
    auto file = std::make_unique<std::fstream>(path, std::ios::in | std::ios::binary);
    if (!*file) unreadable(path, std::strerror(errno));
    if (!std::filesystem::is_regular_file(path, error)) return ofStream(*file, path); // a pipe
    ImportSource source;
    source._name = path;
    source._bytes = std::filesystem::file_size(path, error);
    source._file = std::move(file);
    source.decode();
    return source;
}

ImportSource ImportSource::ofStream(std::istream& in, const std::string& name, uint64_t bytes) {
    ImportSource source;
    source._name = name;
    source._bytes = bytes;
    if (in.tellg() != std::istream::pos_type(-1)) {
        source._borrowed = &in;
    } else {
        in.clear();
        source._file = temporaryFile(name);
        if (in.peek() != std::istream::traits_type::eof()) *source._file << in.rdbuf();
        if (in.bad()) unreadable(name, std::strerror(errno));
        if (!source._file->flush()) unreadable(name, "the temporary file cannot be written. Is the disk full?");
        source._bytes = static_cast<uint64_t>(source._file->tellp());
        source._file->seekg(0);
    }
    source.decode();
    return source;
}

void ImportSource::decode() {
    if (!beginsAsUTF16(start())) return;
    const auto converted = textFromUTF16(whole(kMostUTF16));
    if (!converted) unreadable(_name, "it begins as UTF-16 and is none. Save it as UTF-8 and import it again");
    _wasUTF16 = true;
    _bytes = converted->size();
    _memory = std::make_unique<std::istringstream>(*converted);
}

std::string ImportSource::start() {
    std::string bytes(kStartBytes, '\0');
    std::istream& in = text();
    in.read(bytes.data(), static_cast<std::streamsize>(bytes.size()));
    if (in.bad()) unreadable(_name, std::strerror(errno));
    bytes.resize(static_cast<size_t>(in.gcount()));
    in.clear();
    in.seekg(0);
    return bytes;
}

std::string ImportSource::whole(size_t limitBytes) {
    std::string bytes;
    std::string block(64 << 10, '\0');
    std::istream& in = text();
    while (in.read(block.data(), static_cast<std::streamsize>(block.size())) || in.gcount() > 0) {
        bytes.append(block, 0, static_cast<size_t>(in.gcount()));
        if (bytes.size() > limitBytes)
            unreadable(_name, "it is longer than " + std::to_string(limitBytes >> 20) + " MB");
    }
    if (in.bad()) unreadable(_name, std::strerror(errno));
    in.clear();
    in.seekg(0);
    return bytes;
}

} // namespace rolvane
