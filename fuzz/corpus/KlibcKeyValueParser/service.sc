[ssh]
title="SSH"
desc="Encrypted terminal"
port_forward="yes"
dst.ports="22/tcp"
