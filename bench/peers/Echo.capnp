@0xd7b1c9a4e3f25816;

interface CapnProtoEcho {
  # Takes bytes and gives as many back as are asked for.
  exchange @0 (data :Data, wanted :UInt64) -> (data :Data);
}
