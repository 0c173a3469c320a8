// Memory that knows its size, for the elements of arrays and for frames that are received.
#pragma once

namespace foundation::korveldata {

char* newBuffer(unsigned long size);
void deleteBuffer(char* buffer);
unsigned long sizeOf(const char* buffer);

}  // namespace foundation::korveldata
