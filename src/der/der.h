// The whole DER decoder: item decoding, sequence walking and templates, primitive contents.
#pragma once

#include "der/der_item.h"        // IWYU pragma: export
#include "der/der_primitives.h"  // IWYU pragma: export
#include "der/der_sequence.h"    // IWYU pragma: export
#include "der/der_types.h"       // IWYU pragma: export
