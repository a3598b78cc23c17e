"""Harness of the end-to-end tests: instances, their configuration file, clients, raw messages."""
