// Result<T>: a value or an OMError. The project's one fallible-return type (GCC 12 has no
// std::expected). Result<void> carries only success or an error.
#pragma once

#include <cassert>
#include <utility>
#include <variant>

#include "platform/OMError.h"

namespace om {

template <typename T> class [[nodiscard]] Result {
public:
    Result(T value)
        : m_storage(std::in_place_index<0>, std::move(value))
    {
    }
    Result(OMError error)
        : m_storage(std::in_place_index<1>, std::move(error))
    {
    }

    bool ok() const { return m_storage.index() == 0; }
    explicit operator bool() const { return ok(); }

    T& value() &
    {
        assert(ok());
        return std::get<0>(m_storage);
    }
    const T& value() const&
    {
        assert(ok());
        return std::get<0>(m_storage);
    }
    T releaseValue() &&
    {
        assert(ok());
        return std::move(std::get<0>(m_storage));
    }
    const OMError& error() const
    {
        assert(!ok());
        return std::get<1>(m_storage);
    }

    T* operator->() { return &value(); }
    const T* operator->() const { return &value(); }
    T& operator*() & { return value(); }
    const T& operator*() const& { return value(); }

private:
    std::variant<T, OMError> m_storage;
};

template <> class [[nodiscard]] Result<void> {
public:
    Result() = default;
    Result(OMError error)
        : m_error(std::move(error))
    {
    }

    bool ok() const { return !m_error.has_value(); }
    explicit operator bool() const { return ok(); }
    const OMError& error() const
    {
        assert(!ok());
        return *m_error;
    }
    void releaseValue() && { }

private:
    std::optional<OMError> m_error;
};

} // namespace om

// Propagates the error of a Result-returning expression; otherwise yields its value.
// (A GCC/Clang statement expression, so error paths stay one line.)
#define OM_TRY(expression)                                                                                             \
    ({                                                                                                                 \
        auto omTryResult_ = (expression);                                                                              \
        if (!omTryResult_.ok())                                                                                        \
            return omTryResult_.error();                                                                               \
        std::move(omTryResult_).releaseValue();                                                                        \
    })
