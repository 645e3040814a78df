@0xc4a9d0e7b25f3c18;

# What the tests and the benchmark of this room call.

using Cxx = import "/capnp/c++.capnp";
using Common = import "/protocols/common.capnp";
$Cxx.namespace("yomber::ipc::test");

interface Echo {
  echo @0 (value :UInt64, data :Data) -> (value :UInt64, data :Data);
  # Answers what it was given.

  hang @1 () -> ();
  # Never answers; says so when it is cancelled.

  fail @2 (reason :Text) -> ();
  # Throws.

  work @3 (value :UInt64, hold :Bool) -> (value :UInt64);
  # The value plus one, made on the pool; held back until released or cancelled.

  callBack @4 (callback :Callback, times :UInt32) -> (sum :UInt64);
  # The sum of what `times` calls of the callback answer.

  makeCounter @5 () -> (counter :Counter);

  openDescriptor @6 (text :Text) -> (descriptor :Descriptor);
  # A capability that carries a pipe from which `text` can be read.

  readDescriptor @7 (descriptor :Descriptor) -> (text :Text);
  # What can be read from the capability's descriptor.

  page @8 (offset :UInt64, limit :UInt32, itemBytes :UInt32) -> (items :List(Row));

  large @9 (bytes :UInt64) -> (data :Data);
  # A reply of that many bytes.
}

interface Callback {
  next @0 (index :UInt32) -> (value :UInt64);
}

interface Counter {
  add @0 (amount :UInt64) -> (total :UInt64);
}

interface Descriptor {}

struct Row {
  id @0 :UInt64;
  size @1 :UInt64;
  modified @2 :Int64;
  name @3 :Data;
  payload @4 :Data;
}
