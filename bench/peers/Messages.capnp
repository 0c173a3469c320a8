@0xb5e1d07c3a9f4e62;

struct CapnProtoMessages {
  struct Id {
    hi @0 :UInt64;
    lo @1 :UInt64;
  }

  struct Line {
    id @0 :Id;
    stream @1 :Int32;
    text @2 :Text;
  }

  struct Frame {
    file @0 :Text;
    function @1 :Text;
    line @2 :Float64;
  }

  struct Error {
    status @0 :Int32;
    identifier @1 :Text;
    text @2 :Text;
    function @3 :Text;
    frames @4 :List(Frame);
    causes @5 :List(Error);
  }
}
