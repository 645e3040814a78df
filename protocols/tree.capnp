@0xd3b62f0c9a5e4718;

# What zarn tells a mount, which shows the tree on disk and lets the kernel cache all of it for good:
# everything that changes there, whoever does it, and which names are shown otherwise than they are on
# disk. Begun with `Daemon.observeTree`; needs no account.
#
# Everything is said in terms of the disk, so that a mount needs no identifiers: folders by the inode
# number that the tree's file system gives them, entries by their names on disk. All of it is idempotent:
# calls say what may have changed and what holds now, and may say it more than once.

using Cxx = import "/capnp/c++.capnp";
$Cxx.namespace("yomber::protocol");

interface TreeObserver {
  # Implemented by the mount. zarn makes one call after the other, each when the last was answered; what
  # happens meanwhile is gathered, each entry once. An observer that fails a call is told nothing more, and
  # let go of: when nobody refers to it any more, it is to observe anew.
  #
  # What is read on disk after `observeTree` was answered is covered: if it changes, a later call says
  # so. What was read before (over an earlier connection, say) is not.

  didStart @0 (shownNames :List(ShownName)) -> ();
  # The first call, and the one after each `didLoseTrack`: every name that is shown otherwise than on
  # disk, and the containers' folders. What was told of names before no longer holds. Of more than 10,000
  # names, the others follow at once in `didChange`.

  didChange @1 (entries :List(Entry), shownNames :List(ShownName)) -> ();
  # Together at most 1,000. New names hold together with what has changed.

  didLoseTrack @2 () -> ();
  # Anything may have changed: more than 50,000 changes were waiting for this observer, or more happened
  # than the system would note. A `didStart` follows. Also said when the first scan of a new database is
  # done: only then are names known.
}

struct Entry {
  # Appeared, is gone, or has changed in any way: its content, its attributes, what it is. An entry that
  # was renamed or moved is told at both places. The folder's own times change with it.

  folder @0 :UInt64;     # its inode number
  name @1 :Data;         # on disk. Empty: any entry of the folder, and the folder itself. ".": the
                         # folder's own attributes only
}

struct ShownName {
  # How an entry is shown from now on.

  folder @0 :UInt64;     # its inode number; of a container's folder: that of its Documents
  name @1 :Data;         # on disk; of a container's folder: empty
  shownName @2 :Data;    # empty: no longer otherwise than on disk, or gone
  location @3 :Data;     # of a container's folder, which the root shows under `shownName`: the absolute
                         # path of its Documents (empty `shownName`: the root shows it no more).
                         # Of any other entry: empty
}
