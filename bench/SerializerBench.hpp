// What serializers cost beside bare Protocol Buffers calls on the same messages.
#pragma once

namespace bench {

/// Registers, for each of codecSamples(),
///
///     serialize/NAME    look-up by type to the last frame appended     beside  bare code that writes the same bytes
///     deserialize/NAME  received message to object                     beside  bare code that reads the same bytes
///
/// for the typical sample of every serializer,
///
///     write/NAME   the object to frames             beside  filling the same messages and serializing them
///     read/NAME    received frames to the object    beside  parsing the same messages from the same frames
///
/// and, for sizes that the samples do not have, text events, arrays beside a copy of their bytes, and the conversion of
/// text beside ICU's.
void addSerializerBenches();

}  // namespace bench
