// Structural equality of two property-list values for the differential fuzz
// targets: reals by their bits (NaN equals itself), dates by their bits, or,
// with `dateAllowed`, by whatever the target tolerates for a pair of dates.
#pragma once

#include <cstring>

#include "Platform/PropertyList.h"

namespace tarn::fuzz {

template <class DatesMatch>
bool SamePlist(const PlistValue& a, const PlistValue& b, DatesMatch&& datesMatch) {
    using T = PlistValue::Type;
    if (a.type() != b.type()) return false;
    switch (a.type()) {
        case T::Real: {
            const double x = *a.asReal(), y = *b.asReal();
            return std::memcmp(&x, &y, sizeof x) == 0;
        }
        case T::Date:
            return datesMatch(a.asDate()->seconds, b.asDate()->seconds);
        case T::Array: {
            const auto &x = *a.asArray(), &y = *b.asArray();
            if (x.size() != y.size()) return false;
            for (size_t i = 0; i < x.size(); ++i)
                if (!SamePlist(x[i], y[i], datesMatch)) return false;
            return true;
        }
        case T::Dict: {
            const auto &x = *a.asDict(), &y = *b.asDict();
            if (x.size() != y.size()) return false;
            for (auto i = x.begin(), j = y.begin(); i != x.end(); ++i, ++j)
                if (i->first != j->first || !SamePlist(i->second, j->second, datesMatch))
                    return false;
            return true;
        }
        default:
            return a == b;
    }
}

inline bool SameBits(double x, double y) { return std::memcmp(&x, &y, sizeof x) == 0; }

}  // namespace tarn::fuzz
