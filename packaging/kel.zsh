#compdef kel
_arguments \
  '-debug[also print what the server did for each request]' \
  '-dump[print the services list]' \
  '-dump_cache[print the cache file]' \
  '-flush[make the server forget what it knows]' \
  '-generate_whitelist[write a restrictions file]' \
  '(- *)-help[print the usage line]' \
  '-mockar[pretend that an application was installed]' \
  '-update[rebuild the services list]' \
  '*:localization:'
