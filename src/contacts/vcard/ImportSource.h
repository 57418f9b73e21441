#pragma once

#include <cstdint>
#include <fstream>
#include <istream>
#include <memory>
#include <string>

namespace rolvane {

// The text of a file or a stream that is to be imported: can be read twice, and is no UTF-16 any more. A stream that
// cannot be wound back goes into a temporary file, which nobody else sees.
// CXException kCXVCardException: it cannot be read, or its UTF-16 is damaged. One thread.
class ImportSource {
public:
    static ImportSource ofFile(const std::string& path);
    // The stream is borrowed; `name` is for messages.
    static ImportSource ofStream(std::istream& in, const std::string& name, uint64_t bytes = 0);

    std::istream& text() { return _memory ? *_memory : _borrowed ? *_borrowed : *_file; } // at its beginning
    std::string start();                  // its first 8 KB; leaves the text at its beginning
    std::string whole(size_t limitBytes); // all of it; an exception when there is more
    const std::string& name() const { return _name; }
    uint64_t bytes() const { return _bytes; } // 0 when not known
    bool wasUTF16() const { return _wasUTF16; }

private:
    void decode();

    std::string _name;
    uint64_t _bytes = 0;
    bool _wasUTF16 = false;
    std::istream* _borrowed = nullptr;
    std::unique_ptr<std::fstream> _file;
    std::unique_ptr<std::istream> _memory;
};

} // namespace rolvane
