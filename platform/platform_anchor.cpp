// Anchor until the client library lands.
