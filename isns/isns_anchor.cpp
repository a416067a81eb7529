// Anchor so this directory's library is never an empty archive.
