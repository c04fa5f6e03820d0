// End-to-end tests of the reference host (being written).
