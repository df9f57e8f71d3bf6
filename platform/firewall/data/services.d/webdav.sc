# WebDAV file access.
[webdav_http]
title="WebDAV (HTTP)"
protocol=tcp
ports=5005
forwardable=yes

[webdav_https]
title="WebDAV (HTTPS)"
protocol=tcp
ports=5006
forwardable=yes
