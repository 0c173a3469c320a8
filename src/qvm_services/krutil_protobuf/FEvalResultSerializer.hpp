// Outcomes of function calls.
#pragma once

#include <google/protobuf/repeated_field.h>

#include <cstdint>
#include <functional>
#include <vector>

#include "TaggedSerializer.hpp"
#include "cmddistributor/FEvalResult.hpp"
#include "krutil.protobuf.FEvalResult.pb.h"

namespace krutil::protobuf_serializer {

/// The outputs are written first and referred to by frame index. An error is written but not read back.
class FEvalResultSerializer final : public TaggedSerializer<FEvalResultSerializer, ResultFamily,
                                                            ::cmddistributor::FEvalResult, protobuf::FEvalResult> {
  public:
    /// How the conversions reach the frames; they know of no others.
    using WriteArrays = std::function<std::vector<DataID>(const std::vector<foundation::korveldata::Array>&)>;
    using ReadArrays = std::function<std::vector<foundation::korveldata::Array>(
        const google::protobuf::RepeatedField<std::uint64_t>&)>;

    static constexpr bool manyParts = true;

    FEvalResultSerializer();

    /// Throws boost::bad_get (in Boost's exception wrapper) for outputs that are not data arrays, and what `write`
    /// throws. Without a callable the outputs are left out.
    static void fill(const ::cmddistributor::FEvalResult& result, protobuf::FEvalResult& proto,
                     const WriteArrays& write);

    /// Throws std::logic_error for an absent result record and for its absent identifier, then what `read` throws. A
    /// bad status in the record's error ends the process, though the error is dropped. Without a callable returns null.
    static std::unique_ptr<::cmddistributor::IIPResult> fromProtobuf(const protobuf::FEvalResult& proto,
                                                                     const ReadArrays& read);

    static void fill(const ::cmddistributor::FEvalResult& result, protobuf::FEvalResult& proto, NestedWriter& nested);
    static std::unique_ptr<::cmddistributor::IIPResult> fromProtobuf(const protobuf::FEvalResult& proto,
                                                                     const NestedReader& nested);
};

}  // namespace krutil::protobuf_serializer
