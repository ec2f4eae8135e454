# The installation's init script: the first line it prints names the account
# core runs under. A real installation prints its service account here; the
# demo names whoever runs it, so that it works for root and for anyone else.
id -un
