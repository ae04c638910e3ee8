// Pictures for sample applications.
#pragma once

#include <cstdint>

#include "platform/brelm.h"

namespace appsync {

// A picture of `size` × `size` pixels that the number chooses: a sloping run of two colours and a symmetric figure.
Image sampleIcon(std::uint64_t number, std::uint32_t size);

}  // namespace appsync
