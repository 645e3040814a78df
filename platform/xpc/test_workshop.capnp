@0xf2c6a8d01b7e4935;

# What the tests of this room call over connections.

using Cxx = import "/capnp/c++.capnp";
using Common = import "/protocols/common.capnp";
$Cxx.namespace("yomber::test");

interface WorkshopService {
  addOne @0 (value :UInt64) -> (value :UInt64);
  work @1 (call :UInt64, name :Text) -> (failure :Common.OptionalError);
  note @2 (value :UInt64) -> ();
  measure @3 (data :Data) -> (size :UInt64);
  polish @4 (value :UInt64) -> (value :UInt64);
  sweep @5 () -> ();
  break @6 () -> (value :UInt64);
}
