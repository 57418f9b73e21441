#pragma once

namespace rolvane {

// Lets a std::unique_ptr own an object of a C library: std::unique_ptr<BIO, Release<BIO_free_all>>. `Free` is the
// library's function that ends such an object. Any thread.
template <auto Free>
struct Release {
    template <class T>
    void operator()(T* object) const {
        Free(object);
    }
};

} // namespace rolvane
