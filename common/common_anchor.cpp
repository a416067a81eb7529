// Anchor so korv_common is never an empty archive.
