#pragma once

#include <atomic>
#include <cstdint>
#include <utility>

namespace rolvane {

// What counts its owners itself, so that a handle on it is one pointer.
class SharedObject {
public:
    SharedObject() = default;
    SharedObject(const SharedObject&) = delete;
    SharedObject& operator=(const SharedObject&) = delete;
    virtual ~SharedObject() = default;

private:
    template <class T>
    friend class SharedPointer;
    std::atomic<uint32_t> _owners{0};
};

// An owner of a SharedObject; T may be incomplete where the pointer is only copied. Counting is safe on any thread.
template <class T>
class SharedPointer {
public:
    SharedPointer() = default;
    explicit SharedPointer(T* object) noexcept : _object(object) { retain(); }
    SharedPointer(const SharedPointer& other) noexcept : _object(other._object) { retain(); }
    SharedPointer(SharedPointer&& other) noexcept : _object(std::exchange(other._object, nullptr)) {}
    SharedPointer& operator=(SharedPointer other) noexcept {
        std::swap(_object, other._object);
        return *this;
    }
    ~SharedPointer() {
        if (_object && _object->_owners.fetch_sub(1, std::memory_order_acq_rel) == 1) delete _object;
    }

    explicit operator bool() const noexcept { return _object != nullptr; }
    T& operator*() const noexcept { return *static_cast<T*>(_object); }
    T* operator->() const noexcept { return static_cast<T*>(_object); }
    friend bool operator==(const SharedPointer& a, const SharedPointer& b) noexcept { return a._object == b._object; }

private:
    void retain() const noexcept {
        if (_object) _object->_owners.fetch_add(1, std::memory_order_relaxed);
    }
    SharedObject* _object = nullptr;
};

} // namespace rolvane
