// Asio is compiled once here (ASIO_SEPARATE_COMPILATION) instead of in every source that uses it.
#include <asio/impl/src.hpp>
